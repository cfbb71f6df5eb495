// Page dispositions from what Linux says of a page: a pagemap entry (with, where it can be
// read, the page's /proc/kpageflags word) or the categories of a PAGEMAP_SCAN run. Pure
// functions on bytes, so they are tested on captured data; RKLinuxPageReader does the reading.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

// /proc/PID/pagemap: one 64-bit entry per virtual page (Documentation/admin-guide/mm/pagemap.rst).
inline constexpr uint64_t RKPagemapPresent = 1ull << 63;
inline constexpr uint64_t RKPagemapSwapped = 1ull << 62;
inline constexpr uint64_t RKPagemapFilePage = 1ull << 61;  // a file page or shared anonymous (shmem)
inline constexpr uint64_t RKPagemapExclusive = 1ull << 56;  // wrong for PMD-mapped huge pages
inline constexpr uint64_t RKPagemapFrameMask = (1ull << 55) - 1;  // 0 unless frames are visible

// /proc/kpageflags: one 64-bit word per page frame.
inline constexpr uint64_t RKKpfDirty = 1ull << 4;
inline constexpr uint64_t RKKpfAnon = 1ull << 12;
inline constexpr uint64_t RKKpfSwapBacked = 1ull << 14;
inline constexpr uint64_t RKKpfHuge = 1ull << 17;
inline constexpr uint64_t RKKpfZeroPage = 1ull << 24;

// PAGEMAP_SCAN (kernel 6.7): page categories of one run of pages.
inline constexpr uint64_t RKPageIsFile = 1ull << 2;
inline constexpr uint64_t RKPageIsPresent = 1ull << 3;
inline constexpr uint64_t RKPageIsSwapped = 1ull << 4;
inline constexpr uint64_t RKPageIsPfnZero = 1ull << 5;

// One run of a PAGEMAP_SCAN answer: [start, end) and its categories (the kernel's page_region).
struct RKPageScanRun {
    uint64_t start = 0;
    uint64_t end = 0;
    uint64_t categories = 0;
};

// The disposition of a page from its pagemap entry. `fileMapping`: the page lives in a mapping
// of a regular file, where a file page is page cache rather than memory. `flags`: its
// kpageflags word when it was read. Without it a file page never counts as dirty, nothing is
// reusable and only a visible frame number could tell the zero page.
uint32_t RKDispositionForPagemapEntry(uint64_t entry, bool fileMapping, std::optional<uint64_t> flags);

// Whether the kpageflags word of this present page changes its disposition, so that it is
// worth reading: file pages of file mappings (dirty) and anonymous pages (zero page, lazily
// freed). Shmem pages are memory whatever their flags say.
bool RKPagemapEntryNeedsFlags(uint64_t entry, bool fileMapping);

// The disposition of every page of a PAGEMAP_SCAN run with these categories; pages in no run
// (holes, pages never touched) are 0.
uint32_t RKDispositionForScanRun(uint64_t categories, bool fileMapping);

// A lazily freed page that was written again keeps its flags and only the mapping's LazyFree
// count knows: keeps the reusable mark on the first `reusablePages` pages (packed dispositions,
// in address order) that have it and turns the rest back into dirty memory.
void RKLimitReusablePages(std::span<uint8_t> packed, uint64_t reusablePages);

// Frame numbers sorted and cut into runs of consecutive frames, each at most `maxRun` long,
// so that /proc/kpageflags is read with one pread per run. `frames` must be sorted.
struct RKFrameRun {
    uint64_t first = 0;
    uint64_t count = 0;
};
std::vector<RKFrameRun> RKCoalesceFrames(std::span<const uint64_t> sortedFrames, uint64_t maxRun);

// Dispositions kept one byte a page while a process's page data waits for its queries.
uint8_t RKPackDisposition(uint32_t disposition);
uint32_t RKUnpackDisposition(uint8_t packed);
