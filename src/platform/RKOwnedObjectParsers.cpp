#include "platform/RKOwnedObjectParsers.h"

#include <array>

#include "platform/RKTextFields.h"

namespace {

enum Column : size_t { kShmid, kSize, kCpid, kNattch, kRss, kSwap, kColumnCount };
constexpr std::array<std::string_view, kColumnCount> kColumnNames = {"shmid", "size", "cpid", "nattch", "rss", "swap"};
constexpr size_t kAbsent = ~size_t{0};

// Position of every column memspread reads, kAbsent for one the header lacks.
std::array<size_t, kColumnCount> columnPositions(std::string_view header) {
    std::array<size_t, kColumnCount> positions;
    positions.fill(kAbsent);
    for (size_t index = 0;; index++) {
        std::string_view word = RKNextWord(header);
        if (word.empty()) break;
        for (size_t c = 0; c < kColumnCount; c++)
            if (word == kColumnNames[c]) positions[c] = index;
    }
    return positions;
}

std::optional<RKSysVSegment> parseSegment(std::string_view line, const std::array<size_t, kColumnCount>& positions) {
    std::array<std::string_view, kColumnCount> words{};
    for (size_t index = 0;; index++) {
        std::string_view word = RKNextWord(line);
        if (word.empty()) break;
        for (size_t c = 0; c < kColumnCount; c++)
            if (positions[c] == index) words[c] = word;
    }
    RKSysVSegment segment;
    bool ok = RKParseDecimal(words[kShmid], segment.shmid) && RKParseDecimal(words[kSize], segment.size) &&
              RKParseDecimal(words[kCpid], segment.creator) && RKParseDecimal(words[kNattch], segment.attached) &&
              RKParseDecimal(words[kRss], segment.resident) && RKParseDecimal(words[kSwap], segment.swapped);
    if (!ok) return std::nullopt;
    return segment;
}

}  // namespace

std::vector<RKSysVSegment> RKParseSysVShm(std::string_view text) {
    std::vector<RKSysVSegment> segments;
    const auto positions = columnPositions(RKNextLine(text));
    for (size_t position : positions)
        if (position == kAbsent) return segments;
    while (!text.empty()) {
        std::string_view line = RKNextLine(text);
        if (auto segment = parseSegment(line, positions)) segments.push_back(*segment);
    }
    return segments;
}

std::optional<RKDmaBufInfo> RKParseDmaBufFdinfo(std::string_view text) {
    RKDmaBufInfo info;
    bool haveSize = false, haveInode = false;
    while (!text.empty()) {
        std::string_view line = RKNextLine(text);
        size_t colon = line.find(':');
        if (colon == std::string_view::npos) continue;
        std::string_view name = line.substr(0, colon);
        std::string_view value = line.substr(colon + 1);
        size_t begin = value.find_first_not_of(" \t");
        value = begin == std::string_view::npos ? std::string_view{} : value.substr(begin);
        if (name == "size") haveSize = RKParseDecimal(value, info.size);
        else if (name == "ino") haveInode = RKParseDecimal(value, info.inode);
        else if (name == "exp_name") info.exporter = std::string(value);
    }
    if (!haveSize || !haveInode) return std::nullopt;
    return info;
}
