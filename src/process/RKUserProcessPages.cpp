// Page dispositions of a live user process: the chunked queries (which skip the holes the
// platform knows of, so that a sparse terabyte costs its pages, not its size), the sizing of a
// region from dispositions (with the page two adjacent regions share), and the runs of like
// pages that let the analysis tell which pages of an object each process holds.
#include <algorithm>
#include <vector>

#include "model/RKAssert.h"
#include "model/RKMemoryRegion.h"
#include "model/RKMemoryTotal.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint64_t kChunkPages = 4096;  // pages per kernel query

enum class RKPageKind { none = 0, dirty = 1, swapped = 2, reclaimable = 3, clean = 4 };

bool countsAsDirty(uint32_t disposition) {
    return (disposition & (VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL)) == VM_PAGE_QUERY_PAGE_PRESENT ||
           (disposition & VM_PAGE_QUERY_PAGE_DIRTY);
}

// Adds `bytes` to the counter the disposition counts in: dirty, else swapped, else none.
void charge(uint32_t disposition, uint64_t bytes, uint64_t& dirty, uint64_t& swapped) {
    if (countsAsDirty(disposition)) {
        dirty += bytes;
    } else if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) {
        swapped += bytes;
    }
}

RKPageKind pageKind(uint32_t disposition, uint32_t reclaimableBit) {
    if (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) return RKPageKind::swapped;
    if (disposition & VM_PAGE_QUERY_PAGE_DIRTY) return RKPageKind::dirty;
    if (disposition & reclaimableBit) return RKPageKind::reclaimable;
    if (disposition & VM_PAGE_QUERY_PAGE_PRESENT) return RKPageKind::clean;
    return RKPageKind::none;
}

// The run of like pages that _addSubrangesForRegion grows across chunks.
class RKPageRun {
public:
    RKPageRun(RKMemoryRegion& region, uint64_t pageSize) : region_(region), pageSize_(pageSize), offset_(region.offset) {}

    void add(RKPageKind kind) {
        if (kind != kind_ && kind_ != RKPageKind::none && length_ != 0) flush();
        kind_ = kind;
        (kind == RKPageKind::none ? offset_ : length_) += pageSize_;
    }
    // `pages` pages that hold nothing, as many add(none) would, at once.
    void skip(uint64_t pages) {
        if (kind_ != RKPageKind::none && length_ != 0) flush();
        kind_ = RKPageKind::none;
        offset_ += pages * pageSize_;
    }

private:
    void flush() {
        RKMemoryTotal total{};
        switch (kind_) {
            case RKPageKind::dirty: total.dirty = length_; break;
            case RKPageKind::swapped: total.swapped = length_; break;
            case RKPageKind::reclaimable: total.reclaimable = length_; break;
            case RKPageKind::clean: total.clean = length_; break;
            case RKPageKind::none: RKAssertionFailure("RKUserProcess", "Tried to add an empty subrange");
        }
        if (region_.wired) total.wired = length_;
        region_.addSubrange(offset_, length_, total, pageSize_);
        offset_ += length_;
        length_ = 0;
    }

    RKMemoryRegion& region_;
    uint64_t pageSize_;
    uint64_t offset_;
    uint64_t length_ = 0;
    RKPageKind kind_ = RKPageKind::none;
};

}  // namespace

bool RKUserProcess::_enumerateDispositionChunks(uint64_t startAddr, uint64_t pagesToQuery,
                                                const RKDispositionChunkBlock& block) {
    if (pagesToQuery == 0) return true;
    const uint64_t page = pageSize();
    const uint64_t end = startAddr + pagesToQuery * page;
    std::vector<uint32_t> buffer(std::min(pagesToQuery, kChunkPages));
    uint64_t address = startAddr;
    while (address < end) {
        RKPageSpan span = task_ ? RKPlatform::current().pageQueryPopulated(*task_, address, end) : RKPageSpan{address, end};
        // Whole pages within what is asked, and always moving on, whatever the platform says.
        span.from = std::clamp(span.from & ~(page - 1), address, end);
        span.to = std::clamp((span.to + page - 1) & ~(page - 1), span.from, end);
        if (span.to == address) span.to = end;
        if (span.from > address) {
            block(nullptr, (address - startAddr) / page, (span.from - address) / page);
            address = span.from;
        }
        while (address < span.to) {
            const uint64_t asked = std::min(kChunkPages, (span.to - address) / page);
            uint64_t count = asked;
            kern_return_t result = task_ ? RKPlatform::current().pageRangeQuery(*task_, address, count * page, buffer.data(), count)
                                         : KERN_INVALID_ARGUMENT;
            if (result != KERN_SUCCESS) {
                mach_error("mach_vm_page_range_query", result);
                _processMachVMError(result, KERN_INVALID_ARGUMENT);
                pageQueryFailed_ = true;
                return false;
            }
            block(buffer.data(), (address - startAddr) / page, count);
            address += asked * page;
        }
    }
    return true;
}

bool RKUserProcess::_populateMemoryRegionWithPageQueries(RKMemoryRegion& region, const RKRegionSubmapInfo&) {
    RKAssert(region.dirtySize == 0 && region.swappedSize == 0, "RKUserProcess",
             "region.dirtySize == 0 && region.swappedSize == 0");
    const uint64_t page = pageSize();
    const uint64_t start = region.start, end = region.end();
    const uint64_t firstPage = start & ~(page - 1);
    const uint64_t endBoundary = (end + page - 1) & ~(page - 1);
    const bool startUnaligned = firstPage != start, endUnaligned = endBoundary != end;
    const uint64_t firstPageBytes = std::min(region.size, page - (start - firstPage));
    uint64_t pages = (endBoundary - firstPage) / page;
    uint64_t dirty = 0, swapped = 0;
    uint64_t queryStart = firstPage;

    // The page this region shares with the previous one was queried with it.
    const bool firstCached = firstPage == cachedDispositionAddress_;
    if (firstCached) {
        pages -= 1;
        queryStart = firstPage + page;
        charge(cachedDisposition_, firstPageBytes, dirty, swapped);
    }

    if (region.unusedSharedCacheRegion) {
        if (!firstCached && startUnaligned)
            RKAssertionFailure("RKUserProcess", "Unused shared cache region has no cache entry for non-page-aligned start address");
        if (firstCached) {
            region.dirtySize = dirty;
            region.swappedSize = swapped;
        }
        if (endUnaligned && pages != 0) pendingUnusedSharedRegion_ = &region;
        return true;
    }

    // The page at `index` of those queried: the first and last may be partial, the first may
    // be shared with a pending unused region, the last with the next region.
    auto onePage = [&](uint64_t index, uint32_t disposition) {
        const bool partialFirst = index == 0 && !firstCached && startUnaligned;
        const bool partialLast = index == pages - 1 && endUnaligned && !partialFirst;
        uint64_t bytes = page;
        if (partialFirst) {
            bytes = firstPageBytes;
        } else if (partialLast) {
            bytes = end - (endBoundary - page);
            RKAssert(bytes <= region.size, "RKUserProcess", "partial last page within the region");
        }
        charge(disposition, bytes, dirty, swapped);
        if (partialFirst && pendingUnusedSharedRegion_) {
            RKMemoryRegion& pending = *pendingUnusedSharedRegion_;
            RKAssert(pending.end() == start, "RKUserProcess", "pending unused shared region ends here");
            const uint64_t shared = pending.end() - (pending.end() & ~(page - 1));
            RKAssert(shared <= pending.size, "RKUserProcess", "shared bytes within the pending region");
            charge(disposition, shared, pending.dirtySize, pending.swappedSize);
            pendingUnusedSharedRegion_ = nullptr;
        }
        if (partialLast) {
            cachedDispositionAddress_ = endBoundary - page;
            cachedDisposition_ = disposition;
        }
    };
    bool queried = _enumerateDispositionChunks(queryStart, pages, [&](const uint32_t* dispositions, uint64_t first,
                                                                       uint64_t count) {
        if (dispositions) {
            for (uint64_t j = 0; j < count; j++) onePage(first + j, dispositions[j]);
            return;
        }
        // A hole charges nothing; only its ends can be pages with more to do than counting.
        onePage(first, 0);
        if (count > 1) onePage(first + count - 1, 0);
    });
    region.swappedSize = swapped;
    region.dirtySize = dirty;
    return queried;
}

void RKUserProcess::_addSubrangesForRegion(RKMemoryRegion& region, int purgeState) {
    RKAssert(!region.ownedExclusivelyByParentProcess, "RKUserProcess", "!region.ownedExclusivelyByParentProcess");
    const uint64_t page = pageSize();
    const uint64_t firstPage = region.start & ~(page - 1);
    const uint64_t endBoundary = (region.end() + page - 1) & ~(page - 1);
    const uint32_t reclaimableBit =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;
    RKPageRun run(region, page);
    bool queried = _enumerateDispositionChunks(firstPage, (endBoundary - firstPage) / page,
                                               [&](const uint32_t* dispositions, uint64_t, uint64_t count) {
        if (!dispositions) return run.skip(count);
        for (uint64_t j = 0; j < count; j++) run.add(pageKind(dispositions[j], reclaimableBit));
    });
    // Runs of a region only partly read would undercount it: its counters stand instead.
    if (queried) {
        run.skip(1);  // ends the last run
    } else {
        region.freeSubrangeList();
    }
}

void RKUserProcess::_addSubrangesIfEligible(const std::shared_ptr<RKMemoryRegion>& region, const RKRegionSubmapInfo& info,
                                            int purgeState, RKRegionWalkState& state) {
    if (_noteSharedAnonymousRegion(region, info, state)) return;
    if (!state.breakDown || state.sharingAnalysisDisabled || state.hidden ||
        !region->eligibleForSubrangesUsingPageSize(pageSize()))
        return;
    // Where a dirty file page looks like a clean one, the mapping's own counters say more.
    const bool fileBacked = info.external_pager != 0;
    if (fileBacked && !RKPlatform::current().pageQueryAbilities().dirtyFilePages) return;
    state.subrangeCandidates.push_back(
        {region, purgeState, RKPageQueryRange{region->start, region->size, fileBacked, info.pages_reusable}});
}

void RKUserProcess::_addPendingSubranges(RKRegionWalkState& state) {
    if (state.subrangeCandidates.empty()) return;
    const bool live = task_ && _isAlive();
    if (live) {
        std::vector<RKPageQueryRange> ranges;
        ranges.reserve(state.subrangeCandidates.size());
        for (const auto& candidate : state.subrangeCandidates) ranges.push_back(candidate.range);
        RKPlatform::current().preparePageRangeQueries(*task_, ranges);
    }
    for (const auto& candidate : state.subrangeCandidates) {
        if (pageQueryFailed_) break;  // one warning for a process that went away
        _addSubrangesForRegion(*candidate.region, candidate.purgeState);
    }
    if (live) RKPlatform::current().preparePageRangeQueries(*task_, {});
    state.subrangeCandidates.clear();
}
