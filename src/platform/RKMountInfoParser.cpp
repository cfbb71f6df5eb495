#include "platform/RKMountInfoParser.h"

#include <charconv>

namespace {

bool parseDevice(std::string_view field, uint32_t& major, uint32_t& minor) {
    size_t colon = field.find(':');
    if (colon == std::string_view::npos) return false;
    const char* begin = field.data();
    auto [majorEnd, ec1] = std::from_chars(begin, begin + colon, major);
    auto [minorEnd, ec2] = std::from_chars(begin + colon + 1, begin + field.size(), minor);
    return ec1 == std::errc() && ec2 == std::errc() && majorEnd == begin + colon &&
           minorEnd == begin + field.size();
}

RKMountKind kindOf(std::string_view fsType) {
    if (fsType == "tmpfs") return RKMountKind::Tmpfs;
    if (fsType == "hugetlbfs") return RKMountKind::Hugetlbfs;
    return RKMountKind::Other;
}

// "id parent MAJ:MIN root mountpoint options [optional...] - fstype source superoptions"
void parseLine(std::string_view line, RKMountTable& table) {
    size_t first = line.find(' ');
    size_t second = first == std::string_view::npos ? first : line.find(' ', first + 1);
    if (second == std::string_view::npos) return;
    size_t third = line.find(' ', second + 1);
    if (third == std::string_view::npos) return;
    uint32_t major = 0, minor = 0;
    if (!parseDevice(line.substr(second + 1, third - second - 1), major, minor)) return;
    size_t separator = line.find(" - ", third);
    if (separator == std::string_view::npos) return;
    std::string_view rest = line.substr(separator + 3);
    table.emplace(RKDeviceKey(major, minor), kindOf(rest.substr(0, rest.find(' '))));
}

}  // namespace

RKMountTable RKParseMountInfo(std::string_view text) {
    RKMountTable table;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        parseLine(text.substr(0, newline), table);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    }
    return table;
}
