#include "platform/RKOwnedObjectParsers.h"

#include <array>
#include <charconv>

namespace {

// Splits off the next line of `text`.
std::string_view nextLine(std::string_view& text) {
    size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    return line;
}

// Splits off the next blank-separated word of `line`; empty at the end.
std::string_view nextWord(std::string_view& line) {
    size_t begin = line.find_first_not_of(" \t");
    if (begin == std::string_view::npos) {
        line = {};
        return {};
    }
    line.remove_prefix(begin);
    size_t end = line.find_first_of(" \t");
    std::string_view word = line.substr(0, end);
    line.remove_prefix(end == std::string_view::npos ? line.size() : end);
    return word;
}

template <typename Number>
bool parseNumber(std::string_view word, Number& value) {
    auto [end, ec] = std::from_chars(word.data(), word.data() + word.size(), value);
    return ec == std::errc() && end == word.data() + word.size();
}

enum Column : size_t { kShmid, kSize, kCpid, kNattch, kRss, kSwap, kColumnCount };
constexpr std::array<std::string_view, kColumnCount> kColumnNames = {"shmid", "size", "cpid", "nattch", "rss", "swap"};
constexpr size_t kAbsent = ~size_t{0};

// Position of every column memspread reads, kAbsent for one the header lacks.
std::array<size_t, kColumnCount> columnPositions(std::string_view header) {
    std::array<size_t, kColumnCount> positions;
    positions.fill(kAbsent);
    for (size_t index = 0;; index++) {
        std::string_view word = nextWord(header);
        if (word.empty()) break;
        for (size_t c = 0; c < kColumnCount; c++)
            if (word == kColumnNames[c]) positions[c] = index;
    }
    return positions;
}

std::optional<RKSysVSegment> parseSegment(std::string_view line, const std::array<size_t, kColumnCount>& positions) {
    std::array<std::string_view, kColumnCount> words{};
    for (size_t index = 0;; index++) {
        std::string_view word = nextWord(line);
        if (word.empty()) break;
        for (size_t c = 0; c < kColumnCount; c++)
            if (positions[c] == index) words[c] = word;
    }
    RKSysVSegment segment;
    bool ok = parseNumber(words[kShmid], segment.shmid) && parseNumber(words[kSize], segment.size) &&
              parseNumber(words[kCpid], segment.creator) && parseNumber(words[kNattch], segment.attached) &&
              parseNumber(words[kRss], segment.resident) && parseNumber(words[kSwap], segment.swapped);
    if (!ok) return std::nullopt;
    return segment;
}

}  // namespace

std::vector<RKSysVSegment> RKParseSysVShm(std::string_view text) {
    std::vector<RKSysVSegment> segments;
    const auto positions = columnPositions(nextLine(text));
    for (size_t position : positions)
        if (position == kAbsent) return segments;
    while (!text.empty()) {
        std::string_view line = nextLine(text);
        if (auto segment = parseSegment(line, positions)) segments.push_back(*segment);
    }
    return segments;
}

std::optional<RKDmaBufInfo> RKParseDmaBufFdinfo(std::string_view text) {
    RKDmaBufInfo info;
    bool haveSize = false, haveInode = false;
    while (!text.empty()) {
        std::string_view line = nextLine(text);
        size_t colon = line.find(':');
        if (colon == std::string_view::npos) continue;
        std::string_view name = line.substr(0, colon);
        std::string_view value = line.substr(colon + 1);
        size_t begin = value.find_first_not_of(" \t");
        value = begin == std::string_view::npos ? std::string_view{} : value.substr(begin);
        if (name == "size") haveSize = parseNumber(value, info.size);
        else if (name == "ino") haveInode = parseNumber(value, info.inode);
        else if (name == "exp_name") info.exporter = std::string(value);
    }
    if (!haveSize || !haveInode) return std::nullopt;
    return info;
}
