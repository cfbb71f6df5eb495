#include "platform/RKSlabinfoParser.h"

#include <array>

#include "platform/RKTextFields.h"

namespace {

// "name active num objsize perslab pagesperslab : tunables l b s : slabdata active num avail"
bool parseLine(std::string_view line, RKSlabCache& cache) {
    cache.name = RKNextWord(line);
    std::array<uint64_t, 5> head{};
    for (uint64_t& value : head)
        if (!RKParseDecimal(RKNextWord(line), value)) return false;
    if (RKNextWord(line) != ":" || RKNextWord(line) != "tunables") return false;
    for (int i = 0; i < 3; ++i) RKNextWord(line);
    if (RKNextWord(line) != ":" || RKNextWord(line) != "slabdata") return false;
    if (!RKParseDecimal(RKNextWord(line), cache.activeSlabs)) return false;
    if (!RKParseDecimal(RKNextWord(line), cache.slabs)) return false;
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
        std::string_view line = RKNextLine(text);
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
