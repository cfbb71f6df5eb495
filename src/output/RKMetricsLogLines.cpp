#include "output/RKMetricsLogLines.h"

#include <charconv>
#include <cmath>

#include "output/RKJsonWriter.h"

namespace {

// Whole numbers (every byte count) as plain integers; anything else in the shortest form that
// reads back to the same double. Neither depends on the locale.
void appendNumber(std::string& out, double value) {
    if (!std::isfinite(value)) {
        out += "null";
        return;
    }
    constexpr double kExactIntegers = 9007199254740992.0;  // 2^53
    char text[32];
    std::to_chars_result result;
    if (std::fabs(value) < kExactIntegers && value == std::trunc(value))
        result = std::to_chars(text, text + sizeof text, static_cast<int64_t>(value));
    else
        result = std::to_chars(text, text + sizeof text, value);
    out.append(text, result.ptr);
}

void appendMember(std::string& out, const char* key) {
    if (out.back() != '{') out.push_back(',');
    RKAppendJsonString(out, key);
    out.push_back(':');
}

void appendObject(std::string& out, const RKMetricsLogValue::Pairs& pairs) {
    out.push_back('{');
    for (const auto& [key, text] : pairs) {
        if (out.back() != '{') out.push_back(',');
        RKAppendJsonString(out, key);
        out.push_back(':');
        RKAppendJsonString(out, text);
    }
    out.push_back('}');
}

}  // namespace

std::string RKMetricsLogHeaderLine(const std::string& name, const std::string& description,
                                   const std::string& primaryMetric) {
    std::string line = "{";
    appendMember(line, "log");
    RKAppendJsonString(line, name);
    appendMember(line, "format");
    line += "1";
    appendMember(line, "description");
    RKAppendJsonString(line, description);
    appendMember(line, "primary_metric");
    RKAppendJsonString(line, primaryMetric);
    line += "}\n";
    return line;
}

std::string RKMetricsLogValueLine(const RKMetricsLogValue& value, double time) {
    std::string line = "{";
    appendMember(line, "group");
    line += std::to_string(value.group);
    appendMember(line, "time");
    appendNumber(line, time);
    appendMember(line, "metric");
    RKAppendJsonString(line, value.metric);
    appendMember(line, "unit");
    RKAppendJsonString(line, value.unit);
    appendMember(line, "value");
    appendNumber(line, value.value);
    appendMember(line, "variables");
    appendObject(line, value.variables);
    appendMember(line, "labels");
    appendObject(line, value.labels);
    appendMember(line, "tags");
    line.push_back('[');
    for (const auto& tag : value.tags) {
        if (line.back() != '[') line.push_back(',');
        RKAppendJsonString(line, tag);
    }
    line += "]}\n";
    return line;
}

void RKMetricsLogSetPair(RKMetricsLogValue::Pairs& pairs, const std::string& key, const std::string& text) {
    for (auto& pair : pairs) {
        if (pair.first == key) {
            pair.second = text;
            return;
        }
    }
    pairs.emplace_back(key, text);
}
