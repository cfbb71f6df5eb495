// Totals of a set of categories, in bytes. `dirty` excludes swapped bytes; every formatter
// reports dirty + swapped as the memspread of the set.
#pragma once

#include <cstdint>

struct RKMemoryTotal {
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;
    uint32_t regions = 0;

    bool operator==(const RKMemoryTotal&) const = default;
};
