// Anonymous memory shared across fork or merged by KSM, counted once in its exact sharing set.
//
// Runs after gathering and before identity. Every measured process brings the pages of its
// private anonymous regions that other mappings hold too, by frame (or swap entry), sorted.
// Every distinct page gets its rank, and one walk of each process's list in turn finds, for
// each page, the set of measured processes that map it; a page only one of them maps stays that
// process's private memory. Both walks run on contiguous slices of the processes, a thread each,
// whose sets then join in rank order. Each sharing set (and category name) becomes
// one memory object whose identity is the set: every member gets a region without an address
// whose subranges lie at the page's index in the set's ascending frame list (the same index in
// every member), so the range list counts the page once and the sharing groups put it with
// exactly that set. The regions the pages came from lose them; that last walk runs one process
// per worker thread, as each process writes only its own regions and member regions.
//
// Memory: the packed page records the processes hold (RKSharedPageList, about 4 bytes a page), and while the pass runs about 20 bytes a
// distinct page, 4 more for each slice beyond the first; nothing per page after it. Time linear
// in page records.
#pragma once

#include <memory>
#include <vector>

#include "process/RKProcess.h"

struct RKSharedAnonymousSummary {
    uint64_t sharedPages = 0;        // distinct pages that at least two measured processes map
    uint64_t unattributedBytes = 0;  // shared anonymous bytes of processes whose frames are hidden
};

RKSharedAnonymousSummary RKAttributeSharedAnonymousPages(const std::vector<std::shared_ptr<RKProcess>>& processes);

// Object ids of sharing sets: bit 61 alone of the top three, so never a file object (bit 63) or
// a private id (bit 62).
inline constexpr uint64_t RKSharedAnonymousObjectIdBase = 1ull << 61;
