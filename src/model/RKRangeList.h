// The pieces of one VM object that one or more regions map, with their sizes, so that memory
// reached through several overlapping mappings is counted once. Ranges are in the VM object's
// offset space (a region's `offset`), so mappings of one object at different addresses line up.
//
// Every insertion merges the new range with all nodes whose page-rounded extents (start rounded
// down, end rounded up) overlap or touch it, node by node in ascending order; so nodes ascend by
// location and their rounded extents never overlap or touch (for one page size).
//
// Cost: an insertion at or beyond the last node is placed at once (ranges usually arrive in
// ascending order). Any other insertion is queued and placed, together with the queue, when the
// list is next read (sum, nodes, nodeCount, or adding it to another list): the list is sorted by
// rounded start and split into groups of mutually touching extents, and only groups that hold
// more than one piece replay their insertions in their original order, with the same result as
// inserting them one by one. Building a list of n ranges in any order thus costs O(n log n);
// read the list once it is built, not after every insertion.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "model/RKMemoryTotal.h"

class RKMemoryRegion;

struct RKRangeListNode {
    uint64_t location = 0;
    uint64_t length = 0;
    uint64_t clean = 0;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;

    bool operator==(const RKRangeListNode&) const = default;
};

class RKRangeList {
public:
    // Inserts [location, location + length) with the five sizes of `total` (`regions` is not
    // stored). The page size must be a power of two; any other value merges at byte granularity.
    void addRange(uint64_t location, uint64_t length, uint64_t pageSize, const RKMemoryTotal& total);
    // The region's subranges when it has them, else its whole range and sizes.
    void addRegion(const RKMemoryRegion& region, uint64_t pageSize);
    // Inserts every node of `other`, in its order; `other` is unchanged.
    void _addRangeList(const RKRangeList& other, uint64_t pageSize);

    // The five sizes summed over all nodes; `regions` is 0.
    RKMemoryTotal sum() const;

    bool empty() const { return entries_.empty(); }
    size_t nodeCount() const;
    // The nodes in ascending order (a copy, for inspection).
    std::vector<RKRangeListNode> nodes() const;

private:
    struct Entry {
        RKRangeListNode node;
        uint64_t sequence;  // 0: placed; else the position of a queued insertion
    };
    void _placeQueued() const;

    // Placed nodes in ascending order, then the queued insertions in insertion order, all with
    // queuedPageSize_. Reads place the queue first, hence mutable. A vector, not a deque: most
    // lists hold one node (one per region and per private object, hundreds of thousands at
    // once), and a deque allocates a 512-byte block and its map even when empty. Placing sorts
    // and compacts in place.
    mutable std::vector<Entry> entries_;
    mutable uint64_t queuedCount_ = 0;
    mutable uint64_t queuedPageSize_ = 0;
};
