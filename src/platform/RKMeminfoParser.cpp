#include "platform/RKMeminfoParser.h"

#include <charconv>

#include "platform/RKTextFields.h"

std::optional<std::map<std::string, uint64_t, std::less<>>> RKParseMeminfo(std::string_view text) {
    std::map<std::string, uint64_t, std::less<>> figures;
    while (!text.empty()) {
        std::string_view line = RKNextLine(text);
        size_t colon = line.find(':');
        if (colon == 0 || colon == std::string_view::npos) continue;
        std::string_view rest = line.substr(colon + 1);
        size_t digit = rest.find_first_not_of(' ');
        if (digit == std::string_view::npos) continue;
        uint64_t value = 0;
        auto [end, ec] = std::from_chars(rest.data() + digit, rest.data() + rest.size(), value);
        if (ec != std::errc()) continue;
        std::string_view unit = rest.substr(static_cast<size_t>(end - rest.data()));
        if (unit == " kB") {
            value *= 1024;
        } else if (!unit.empty()) {
            continue;
        }
        figures.insert_or_assign(std::string(line.substr(0, colon)), value);
    }
    if (figures.empty()) return std::nullopt;
    return figures;
}
