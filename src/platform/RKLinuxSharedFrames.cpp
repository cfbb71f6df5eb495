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
#include "platform/RKUniqueFd.h"

namespace {

// Every present page (by frame) and swapped page (by swap entry) of the ranges. Where the
// kernel has PAGEMAP_SCAN, pagemap is read only where it found pages.
kern_return_t readCandidates(int pagemap, uint64_t pageSize, bool scan, const std::vector<RKPageQueryRange>& ranges,
                             std::vector<RKSharedAnonymousPage>& pages) {
    std::vector<RKPageScanRun> runs;
    for (uint32_t r = 0; r < ranges.size(); r++) {
        const bool fileBacked = ranges[r].fileBacked;
        auto take = [&](uint64_t, std::span<const uint64_t> entries) {
            for (uint64_t entry : entries) {
                if (fileBacked && (entry & RKPagemapFilePage)) continue;  // page cache, not a copy
                if ((entry & RKPagemapPresent) && (entry & RKPagemapFrameMask) != 0)
                    pages.push_back({entry & RKPagemapFrameMask, r, 0});
                else if (!(entry & RKPagemapPresent) && (entry & RKPagemapSwapped))
                    pages.push_back({RKSwappedPageKey | (entry & RKPagemapFrameMask), r, 1});
            }
        };
        const uint64_t first = ranges[r].start / pageSize;
        const uint64_t end = (ranges[r].start + ranges[r].size + pageSize - 1) / pageSize;
        if (!scan) {
            if (!RKReadPagemap(pagemap, first, end - first, take)) return KERN_INVALID_ARGUMENT;
            continue;
        }
        kern_return_t result = RKScanPresentPages(pagemap, first * pageSize, end * pageSize, runs);
        if (result != KERN_SUCCESS) return result;
        for (size_t i = 0; i < runs.size();) {
            // Adjacent runs (pages of other categories) in one read.
            const uint64_t start = runs[i].start;
            uint64_t stop = runs[i].end;
            for (i++; i < runs.size() && runs[i].start == stop; i++) stop = runs[i].end;
            if (!RKReadPagemap(pagemap, start / pageSize, (stop - start) / pageSize, take)) return KERN_INVALID_ARGUMENT;
        }
    }
    return KERN_SUCCESS;
}

// Keeps the present pages that more than one mapping holds and that are no zero page, and
// every swapped page (only the pass across processes can tell who else holds those). `pages`
// is sorted: the swapped ones, keyed above every frame, come last.
void keepShared(RKFrameVerdicts& verdicts, int kpagecount, int kpageflags, std::vector<RKSharedAnonymousPage>& pages) {
    const size_t present = static_cast<size_t>(
        std::partition_point(pages.begin(), pages.end(), [](const auto& p) { return !(p.page & RKSwappedPageKey); }) -
        pages.begin());
    std::vector<uint64_t> frames(present);
    for (size_t i = 0; i < present; i++) frames[i] = pages[i].page;
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
    if (!RKProbePageReading(procRoot()).kpageflags) {
        for (const RKPageQueryRange& range : ranges)
            for (const auto& [start, bytes] : target->sharedAnonymousBytes)
                if (start == range.start) sharedBytes += bytes;
        return KERN_NOT_SUPPORTED;
    }
    RKUniqueFd pagemap(::openat(target->directoryFd(), "pagemap", O_RDONLY | O_CLOEXEC));
    if (!pagemap.valid()) return errno == EACCES || errno == EPERM ? KERN_PROTECTION_FAILURE : KERN_INVALID_ARGUMENT;
    kern_return_t result =
        readCandidates(pagemap.get(), kernelPageSize(), RKProbePageReading(procRoot()).pagemapScan, ranges, pages);
    if (result != KERN_SUCCESS) return result;
    std::sort(pages.begin(), pages.end(), [](const auto& a, const auto& b) { return a.page < b.page; });
    RKUniqueFd kpagecount(::open((procRoot() + "/kpagecount").c_str(), O_RDONLY | O_CLOEXEC));
    RKUniqueFd kpageflags(::open((procRoot() + "/kpageflags").c_str(), O_RDONLY | O_CLOEXEC));
    if (!kpagecount.valid() || !kpageflags.valid()) return KERN_NOT_SUPPORTED;
    keepShared(*frameVerdicts_->verdicts(), kpagecount.get(), kpageflags.get(), pages);
    pages.shrink_to_fit();
    return KERN_SUCCESS;
}
