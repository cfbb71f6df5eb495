// /proc/slabinfo (version 2.1) as plain records: one per slab cache, after two header lines.
// Caches that the kernel merged appear once, under one of their names.
#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

struct RKSlabCache {
    std::string_view name;  // points into the parsed text
    uint64_t activeObjects = 0;
    uint64_t objects = 0;
    uint64_t objectSize = 0;  // the slot size, padding and metadata included
    uint64_t objectsPerSlab = 0;
    uint64_t pagesPerSlab = 0;
    uint64_t activeSlabs = 0;
    uint64_t slabs = 0;
};

struct RKSlabinfoParseResult {
    bool knownVersion = false;  // the first line says "slabinfo - version: 2.1"
    size_t malformedLines = 0;
};

// Appends the caches of `text` to `caches`, in file order.
RKSlabinfoParseResult RKParseSlabinfo(std::string_view text, std::vector<RKSlabCache>& caches);
