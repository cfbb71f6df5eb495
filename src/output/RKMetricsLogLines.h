// The lines of a metrics log (docs/metrics-log.md): JSON Lines, one self-describing object per
// line. Pure text, no I/O, so that every byte a process name may hold can be tried on it.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

struct RKMetricsLogValue {
    using Pairs = std::vector<std::pair<std::string, std::string>>;

    uint64_t group = 0;  // 1 for the log's first group
    std::string metric;
    std::string unit;
    double value = 0;
    Pairs variables;  // one entry per key, in the order first recorded
    Pairs labels;
    std::vector<std::string> tags;  // each once, in the order recorded
};

// {"log":...,"format":1,"description":...,"primary_metric":...} and a newline.
std::string RKMetricsLogHeaderLine(const std::string& name, const std::string& description,
                                   const std::string& primaryMetric);
// {"group":N,"time":T,"metric":...,"unit":...,"value":V,"variables":{},"labels":{},"tags":[]}
// and a newline. `time` is Unix seconds. A value that is not finite is written as null.
std::string RKMetricsLogValueLine(const RKMetricsLogValue& value, double time);

// Sets `key` to `text` in `pairs`, keeping the position of a key recorded before.
void RKMetricsLogSetPair(RKMetricsLogValue::Pairs& pairs, const std::string& key, const std::string& text);
