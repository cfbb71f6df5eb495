#include "platform/RKSlabinfoParser.h"

#include <array>
#include <charconv>

namespace {

std::string_view nextWord(std::string_view& line) {
    size_t start = line.find_first_not_of(' ');
    if (start == std::string_view::npos) {
        line = {};
        return {};
    }
    line.remove_prefix(start);
    size_t end = line.find(' ');
    std::string_view word = line.substr(0, end);
    line.remove_prefix(end == std::string_view::npos ? line.size() : end);
    return word;
}

bool number(std::string_view word, uint64_t& value) {
    auto [end, ec] = std::from_chars(word.data(), word.data() + word.size(), value);
    return ec == std::errc() && end == word.data() + word.size();
}

// "name active num objsize perslab pagesperslab : tunables l b s : slabdata active num avail"
bool parseLine(std::string_view line, RKSlabCache& cache) {
    cache.name = nextWord(line);
    std::array<uint64_t, 5> head{};
    for (uint64_t& value : head)
        if (!number(nextWord(line), value)) return false;
    if (nextWord(line) != ":" || nextWord(line) != "tunables") return false;
    for (int i = 0; i < 3; ++i) nextWord(line);
    if (nextWord(line) != ":" || nextWord(line) != "slabdata") return false;
    if (!number(nextWord(line), cache.activeSlabs) || !number(nextWord(line), cache.slabs)) return false;
    cache.activeObjects = head[0];
    cache.objects = head[1];
    cache.objectSize = head[2];
    cache.objectsPerSlab = head[3];
    cache.pagesPerSlab = head[4];
    return !cache.name.empty();
}

}  // namespace

RKSlabinfoParseResult RKParseSlabinfo(std::string_view text, std::vector<RKSlabCache>& caches) {
    RKSlabinfoParseResult result;
    bool first = true;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        if (first) {
            first = false;
            result.knownVersion = line == "slabinfo - version: 2.1";
            continue;
        }
        if (line.empty() || line[0] == '#') continue;
        RKSlabCache cache;
        if (parseLine(line, cache)) {
            caches.push_back(cache);
        } else {
            ++result.malformedLines;
        }
    }
    return result;
}
