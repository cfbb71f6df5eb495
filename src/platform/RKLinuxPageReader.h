// Reading page dispositions of a live process on Linux (docs/linux.md, "Page dispositions"):
// PAGEMAP_SCAN where the kernel has it, to find the pages present or swapped, then pagemap only
// for those where frames are needed; else pread of pagemap in chunks. Where frames are visible,
// /proc/kpageflags read once per process in batches over sorted, coalesced frame runs, never
// one pread per page. What is kept is proportional to the pages found, not to the ranges' size.
#pragma once

#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <vector>

#include "platform/RKKernelTypes.h"
#include "platform/RKPageDispositions.h"

// What this system's page reading can do, probed on our own pages.
struct RKLinuxPageProbe {
    bool pagemapScan = false;  // PAGEMAP_SCAN answers (kernel 6.7 and later)
    bool frames = false;       // pagemap shows frame numbers (root, not in a user namespace)
    bool kpageflags = false;   // and /proc/kpageflags can be read for them
};
// pread of exactly `bytes` at `offset`, looping on short reads; false when the read ends early
// (a process gone, a frame past the end of memory) or fails.
bool RKPreadAll(int fd, void* buffer, size_t bytes, uint64_t offset);

// Probes once per run and per /proc root; later calls answer the first result.
const RKLinuxPageProbe& RKProbePageReading(const std::string& procRoot);

// PAGEMAP_SCAN of [start, end): the runs of pages present (never the zero page) or swapped,
// ascending, with their categories; holes and unmapped gaps cost nothing. KERN_SUCCESS, or the
// failure (KERN_INVALID_ARGUMENT when the process went away).
kern_return_t RKScanPresentPages(int pagemap, uint64_t start, uint64_t end, std::vector<RKPageScanRun>& runs);

// pread of the pagemap entries of `count` pages from virtual page `firstPage`, 4096 a read,
// each chunk handed to `chunk` with the page number of its first entry. False when a read fails.
bool RKReadPagemap(int pagemap, uint64_t firstPage, uint64_t count,
                   const std::function<void(uint64_t firstPage, std::span<const uint64_t> entries)>& chunk);

// `count` pages from virtual page `first` that may hold something; their dispositions are
// packed from `offset` on.
struct RKPageStretch {
    uint64_t first = 0;
    uint64_t count = 0;
    uint64_t offset = 0;
};

// The page data of some ranges of one process, one byte a page found (RKPackDisposition). A
// page of a range that lies in no stretch answers 0.
struct RKLinuxPageData {
    std::vector<RKPageQueryRange> ranges;  // ascending
    size_t rangesRead = 0;                 // the first this many ranges were read whole
    std::vector<RKPageStretch> stretches;  // ascending, disjoint, never adjacent
    std::vector<uint8_t> packed;
    kern_return_t result = KERN_SUCCESS;   // of the one read that filled it

    // The dispositions of the pages from `address`, when one range that was read holds them all.
    bool answer(uint64_t address, uint64_t pageSize, std::span<uint32_t> dispositions) const;
    // When a range that was read holds `address`: the first stretch at or after it whose pages
    // may hold something (with those that follow it a small hole apart, up to a query's worth),
    // clipped to [address, end) and to that range, as [from, to). Pages from `address` to
    // `from` hold nothing; from == to when no stretch is left in the range.
    bool populated(uint64_t address, uint64_t end, uint64_t pageSize, uint64_t& from, uint64_t& to) const;
    // Appends the disposition of `count` pages from `first`, past every page appended so far;
    // 0 (nothing there) keeps nothing.
    void append(uint64_t first, uint64_t count, uint32_t disposition);
};

// Reads the dispositions of `ranges` of the process whose /proc directory is `directoryFd`.
// KERN_INVALID_ARGUMENT when the process is gone, KERN_PROTECTION_FAILURE when it may not be
// read; what was read before a failure stays in `data`.
kern_return_t RKReadPageData(int directoryFd, const std::string& procRoot, uint64_t pageSize,
                             const std::vector<RKPageQueryRange>& ranges, RKLinuxPageData& data);
