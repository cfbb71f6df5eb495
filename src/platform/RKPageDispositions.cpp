#include "platform/RKPageDispositions.h"

#include <algorithm>

#include "platform/RKKernelTypes.h"

namespace {

// Present memory that is not a clean file page: dirty unless lazily freed.
uint32_t presentPage(bool filePage, bool fileMapping, bool dirtyFlag, bool reusable) {
    if (filePage && fileMapping)
        return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL | (dirtyFlag ? VM_PAGE_QUERY_PAGE_DIRTY : 0);
    if (reusable) return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_REUSABLE;
    return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
}

constexpr uint32_t kPackedBits[] = {VM_PAGE_QUERY_PAGE_PRESENT, VM_PAGE_QUERY_PAGE_DIRTY, VM_PAGE_QUERY_PAGE_PAGED_OUT,
                                    VM_PAGE_QUERY_PAGE_EXTERNAL, VM_PAGE_QUERY_PAGE_REUSABLE};

}  // namespace

uint32_t RKDispositionForPagemapEntry(uint64_t entry, bool fileMapping, std::optional<uint64_t> flags) {
    if (entry & RKPagemapPresent) {
        if (flags && (*flags & RKKpfZeroPage)) return 0;  // the shared zero page is no memory
        bool filePage = entry & RKPagemapFilePage;
        bool dirty = flags && (*flags & RKKpfDirty);
        bool reusable = flags && !filePage && (*flags & RKKpfAnon) && !(*flags & RKKpfSwapBacked) &&
                        !(*flags & RKKpfHuge);
        return presentPage(filePage, fileMapping, dirty, reusable);
    }
    if (entry & RKPagemapSwapped) return VM_PAGE_QUERY_PAGE_PAGED_OUT;
    return 0;
}

bool RKPagemapEntryNeedsFlags(uint64_t entry, bool fileMapping) {
    if (!(entry & RKPagemapPresent) || (entry & RKPagemapFrameMask) == 0) return false;
    return !(entry & RKPagemapFilePage) || fileMapping;
}

uint32_t RKDispositionForScanRun(uint64_t categories, bool fileMapping) {
    if ((categories & RKPageIsPresent) && !(categories & RKPageIsPfnZero))
        return presentPage(categories & RKPageIsFile, fileMapping, false, false);
    if (categories & RKPageIsSwapped) return VM_PAGE_QUERY_PAGE_PAGED_OUT;
    return 0;
}

void RKLimitReusablePages(std::span<uint8_t> packed, uint64_t reusablePages) {
    for (uint8_t& page : packed) {
        if (!(RKUnpackDisposition(page) & VM_PAGE_QUERY_PAGE_REUSABLE)) continue;
        if (reusablePages > 0) {
            reusablePages--;
        } else {
            page = RKPackDisposition(VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY);
        }
    }
}

std::vector<RKFrameRun> RKCoalesceFrames(std::span<const uint64_t> sortedFrames, uint64_t maxRun) {
    std::vector<RKFrameRun> runs;
    for (uint64_t frame : sortedFrames) {
        if (!runs.empty()) {
            RKFrameRun& last = runs.back();
            if (frame < last.first + last.count) continue;  // the same frame again
            if (frame == last.first + last.count && last.count < maxRun) {
                last.count++;
                continue;
            }
        }
        runs.push_back({frame, 1});
    }
    return runs;
}

uint8_t RKPackDisposition(uint32_t disposition) {
    uint8_t packed = 0;
    for (size_t bit = 0; bit < std::size(kPackedBits); bit++)
        if (disposition & kPackedBits[bit]) packed |= static_cast<uint8_t>(1u << bit);
    return packed;
}

uint32_t RKUnpackDisposition(uint8_t packed) {
    uint32_t disposition = 0;
    for (size_t bit = 0; bit < std::size(kPackedBits); bit++)
        if (packed & (1u << bit)) disposition |= kPackedBits[bit];
    return disposition;
}
