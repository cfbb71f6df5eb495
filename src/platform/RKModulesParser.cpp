#include "platform/RKModulesParser.h"

#include <charconv>

size_t RKParseModules(std::string_view text, std::vector<RKKernelModule>& modules) {
    size_t malformed = 0;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        if (line.empty()) continue;
        size_t space = line.find(' ');
        RKKernelModule module;
        if (space == 0 || space == std::string_view::npos) {
            ++malformed;
            continue;
        }
        module.name = line.substr(0, space);
        std::string_view rest = line.substr(space + 1);
        auto [end, ec] = std::from_chars(rest.data(), rest.data() + rest.size(), module.size);
        if (ec != std::errc() || (end != rest.data() + rest.size() && *end != ' ')) {
            ++malformed;
            continue;
        }
        modules.push_back(module);
    }
    return malformed;
}
