// Reading page dispositions of a live process on Linux (docs/linux.md, "Page dispositions"):
// PAGEMAP_SCAN where the kernel has it and frames are not needed, else pread of pagemap in
// chunks; where frames are visible, /proc/kpageflags read once per process in batches over
// sorted, coalesced frame runs, never one pread per page.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <vector>

#include "platform/RKKernelTypes.h"

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

// The page data of some ranges of one process, one byte a page (RKPackDisposition).
struct RKLinuxPageData {
    std::vector<RKPageQueryRange> ranges;  // ascending
    std::vector<uint64_t> firstPage;       // index in `packed` of each range's first page
    std::vector<uint8_t> packed;
    kern_return_t result = KERN_SUCCESS;   // of the one read that filled it

    // The dispositions of the `count` pages from `address`, when one range holds them all.
    bool answer(uint64_t address, uint64_t pageSize, std::span<uint32_t> dispositions) const;
};

// Reads the dispositions of `ranges` of the process whose /proc directory is `directoryFd`.
// KERN_INVALID_ARGUMENT when the process is gone, KERN_PROTECTION_FAILURE when it may not be
// read; what was read before a failure stays in `data`.
kern_return_t RKReadPageData(int directoryFd, const std::string& procRoot, uint64_t pageSize,
                             const std::vector<RKPageQueryRange>& ranges, RKLinuxPageData& data);
