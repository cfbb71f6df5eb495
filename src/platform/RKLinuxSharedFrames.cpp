// The anonymous pages a process shares with other mappings (after fork, or merged by KSM),
// identified by frame number, or by swap entry when swapped: pagemap read in chunks (where
// PAGEMAP_SCAN found pages, when the kernel has it), then whether each frame is mapped more
// than once from /proc/kpagecount and /proc/kpageflags, once a frame in a gather
// (RKLinuxFrameVerdicts.h). Exclusivity comes from kpagecount, not pagemap's bit 56, which is
// wrong for PMD-mapped huge pages.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "platform/RKLinuxFrameVerdicts.h"
#include "platform/RKLinuxPageReader.h"
#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTask.h"
#include "platform/RKPageDispositions.h"
#include "platform/RKRadixSort.h"
#include "platform/RKUniqueFd.h"

namespace {

// Ranges up to this many pages, and larger ones whose every page is present, are read from
// pagemap directly: a scan first costs a second walk of pages that are nearly all there.
constexpr uint64_t kDirectPages = 512;
// Small ranges this close together (mappings a guard page apart) share one read, up to a read's
// worth of entries.
constexpr uint64_t kJoinGapPages = 16;
constexpr uint64_t kWindowPages = 4096;

class CandidateReader {
public:
    CandidateReader(int pagemap, uint64_t pageSize, const std::vector<RKPageQueryRange>& ranges,
                    std::vector<RKSharedAnonymousPage>& pages)
        : pagemap_(pagemap), pageSize_(pageSize), ranges_(ranges), pages_(pages) {}

    // Every present page (by frame) and swapped page (by swap entry) of the ranges. Where the
    // kernel has PAGEMAP_SCAN, a large range's pagemap is read only where it found pages.
    kern_return_t read(bool scan) {
        uint64_t present = 0;
        for (const RKPageQueryRange& range : ranges_) present += range.presentPages;
        pages_.reserve(present);
        for (uint32_t r = 0; r < ranges_.size();) {
            if (scan && pages(r) > kDirectPages && ranges_[r].presentPages < pages(r)) {
                kern_return_t result = scanRange(r++);
                if (result != KERN_SUCCESS) return result;
                continue;
            }
            uint32_t last = r + 1;
            while (last < ranges_.size() && (!scan || pages(last) <= kDirectPages) && first(last) >= end(last - 1) &&
                   first(last) - end(last - 1) <= kJoinGapPages && end(last) - first(r) <= kWindowPages)
                last++;
            if (!readWindow(r, last)) return KERN_INVALID_ARGUMENT;
            r = last;
        }
        return KERN_SUCCESS;
    }

private:
    uint64_t first(uint32_t r) const { return ranges_[r].start / pageSize_; }
    uint64_t end(uint32_t r) const { return (ranges_[r].start + ranges_[r].size + pageSize_ - 1) / pageSize_; }
    uint64_t pages(uint32_t r) const { return end(r) - first(r); }

    void take(uint32_t r, std::span<const uint64_t> entries) {
        const bool fileBacked = ranges_[r].fileBacked;
        for (uint64_t entry : entries) {
            if (fileBacked && (entry & RKPagemapFilePage)) continue;  // page cache, not a copy
            if ((entry & RKPagemapPresent) && (entry & RKPagemapFrameMask) != 0)
                pages_.emplace_back(entry & RKPagemapFrameMask, r);
            else if (!(entry & RKPagemapPresent) && (entry & RKPagemapSwapped))
                pages_.emplace_back(RKSwappedPageKey | (entry & RKPagemapFrameMask), r);
        }
    }

    // Ranges [r, last): one read from the first's start to the last's end (or chunked reads of a
    // large range on a kernel without PAGEMAP_SCAN), the holes between them read and dropped.
    bool readWindow(uint32_t r, uint32_t last) {
        const uint64_t from = first(r);
        return RKReadPagemap(pagemap_, from, end(last - 1) - from, [&](uint64_t page, std::span<const uint64_t> entries) {
            const uint64_t to = page + entries.size();
            for (uint32_t i = r; i < last; i++) {
                const uint64_t a = std::max(first(i), page), b = std::min(end(i), to);
                if (a < b) take(i, entries.subspan(a - page, b - a));
            }
        });
    }

    kern_return_t scanRange(uint32_t r) {
        kern_return_t result = RKScanPresentPages(pagemap_, first(r) * pageSize_, end(r) * pageSize_, runs_);
        if (result != KERN_SUCCESS) return result;
        for (size_t i = 0; i < runs_.size();) {
            // Adjacent runs (pages of other categories) in one read.
            const uint64_t start = runs_[i].start;
            uint64_t stop = runs_[i].end;
            for (i++; i < runs_.size() && runs_[i].start == stop; i++) stop = runs_[i].end;
            if (!RKReadPagemap(pagemap_, start / pageSize_, (stop - start) / pageSize_,
                               [&](uint64_t, std::span<const uint64_t> entries) { take(r, entries); }))
                return KERN_INVALID_ARGUMENT;
        }
        return KERN_SUCCESS;
    }

    int pagemap_;
    uint64_t pageSize_;
    const std::vector<RKPageQueryRange>& ranges_;
    std::vector<RKSharedAnonymousPage>& pages_;
    std::vector<RKPageScanRun> runs_;
};

// Keeps the present pages that more than one mapping holds and that are no zero page, and
// every swapped page (only the pass across processes can tell who else holds those). `pages`
// is sorted: the swapped ones, keyed above every frame, come last.
void keepShared(RKFrameVerdicts& verdicts, int kpagecount, int kpageflags, std::vector<RKSharedAnonymousPage>& pages) {
    const size_t present = static_cast<size_t>(
        std::partition_point(pages.begin(), pages.end(), [](const auto& p) { return !p.swapped(); }) -
        pages.begin());
    std::vector<uint64_t> frames(present);
    for (size_t i = 0; i < present; i++) frames[i] = pages[i].page();
    std::vector<uint8_t> shared(present);
    verdicts.shared(kpagecount, kpageflags, frames, shared);
    size_t kept = 0;
    for (size_t i = 0; i < pages.size(); i++)
        if (i >= present || shared[i]) pages[kept++] = pages[i];
    pages.resize(kept);
}

}  // namespace

kern_return_t RKLinuxPlatform::sharedAnonymousPages(RKTask& task, const std::vector<RKPageQueryRange>& ranges,
                                                    std::vector<RKSharedAnonymousPage>& pages, uint64_t& sharedBytes) {
    pages.clear();
    sharedBytes = 0;
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    if (!target) return KERN_INVALID_ARGUMENT;
    if (!pageProbe().kpageflags) {
        sharedBytes = sharedAnonymousBytes(task, ranges);
        return KERN_NOT_SUPPORTED;
    }
    RKUniqueFd pagemap(::openat(target->directoryFd(), "pagemap", O_RDONLY | O_CLOEXEC));
    if (!pagemap.valid()) return errno == EACCES || errno == EPERM ? KERN_PROTECTION_FAILURE : KERN_INVALID_ARGUMENT;
    kern_return_t result = CandidateReader(pagemap.get(), kernelPageSize(), ranges, pages)
                               .read(pageProbe().pagemapScan);
    if (result != KERN_SUCCESS) return result;
    // Swapped pages, rare, sorted apart: their keys would need six passes of the radix sort.
    auto swapped = std::stable_partition(pages.begin(), pages.end(), [](const auto& p) { return !p.swapped(); });
    std::sort(swapped, pages.end(), [](const auto& a, const auto& b) { return a.page() < b.page(); });
    RKRadixSortByKey(std::span(pages.begin(), swapped), [](const RKSharedAnonymousPage& p) { return p.page(); });
    RKUniqueFd kpagecount(::open((procRoot() + "/kpagecount").c_str(), O_RDONLY | O_CLOEXEC));
    RKUniqueFd kpageflags(::open((procRoot() + "/kpageflags").c_str(), O_RDONLY | O_CLOEXEC));
    if (!kpagecount.valid() || !kpageflags.valid()) return KERN_NOT_SUPPORTED;
    keepShared(*frameVerdicts_->verdicts(), kpagecount.get(), kpageflags.get(), pages);
    return KERN_SUCCESS;
}

uint64_t RKLinuxPlatform::sharedAnonymousBytes(RKTask& task, const std::vector<RKPageQueryRange>& ranges) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    if (!target) return 0;
    // Both lists ascend by start: one merge, not a search of the walk's list for every range.
    uint64_t bytes = 0;
    auto walked = target->sharedAnonymousBytes.begin();
    const auto end = target->sharedAnonymousBytes.end();
    for (const RKPageQueryRange& range : ranges) {
        while (walked != end && walked->first < range.start) ++walked;
        if (walked != end && walked->first == range.start) bytes += walked->second;
    }
    return bytes;
}
