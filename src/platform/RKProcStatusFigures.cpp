#include "platform/RKProcStatusFigures.h"

#include <charconv>

namespace {

uint64_t* fieldFor(std::string_view name, RKStatusFigures& figures) {
    if (name == "RssAnon") return &figures.rssAnon;
    if (name == "RssShmem") return &figures.rssShmem;
    if (name == "VmSwap") return &figures.vmSwap;
    if (name == "VmPTE") return &figures.vmPTE;
    if (name == "HugetlbPages") return &figures.hugetlbPages;
    if (name == "VmHWM") return &figures.vmHWM;
    return nullptr;
}

}  // namespace

std::optional<RKStatusFigures> RKParseStatusFigures(std::string_view text) {
    RKStatusFigures figures;
    bool any = false;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        if (line.empty() || (line[0] != 'R' && line[0] != 'V' && line[0] != 'H')) continue;
        size_t colon = line.find(':');
        if (colon == std::string_view::npos) continue;
        uint64_t* field = fieldFor(line.substr(0, colon), figures);
        if (!field) continue;
        std::string_view value = line.substr(colon + 1);
        size_t digit = value.find_first_not_of(" \t");
        if (digit == std::string_view::npos) continue;
        auto [end, ec] = std::from_chars(value.data() + digit, value.data() + value.size(), *field);
        if (ec == std::errc()) any = true;
    }
    if (!any) return std::nullopt;
    return figures;
}
