// Page dispositions of a live user process: the chunked queries, the sizing of a region from
// dispositions (with the page two adjacent regions share), and the runs of like pages that let
// the analysis tell which pages of an object each process holds.
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
    const uint64_t chunkPages = std::min(pagesToQuery, kChunkPages);
    const uint64_t chunks = (pagesToQuery + kChunkPages - 1) / kChunkPages;
    if (chunks == 0) return true;
    const uint64_t page = pageSize();
    std::vector<uint32_t> buffer(chunkPages);
    uint64_t address = startAddr;
    uint64_t remaining = pagesToQuery;
    for (uint64_t chunk = 0; chunk < chunks; chunk++) {
        uint64_t count = std::min(remaining, chunkPages);
        kern_return_t result = task_ ? RKPlatform::current().pageRangeQuery(*task_, address, count * page, buffer.data(), count)
                                     : KERN_INVALID_ARGUMENT;
        if (result != KERN_SUCCESS) {
            mach_error("mach_vm_page_range_query", result);
            _processMachVMError(result, KERN_INVALID_ARGUMENT);
            pageQueryFailed_ = true;
            return false;
        }
        block(buffer.data(), count, chunk, chunks);
        address += kChunkPages * page;
        remaining -= std::min(remaining, kChunkPages);
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

    bool queried = _enumerateDispositionChunks(queryStart, pages, [&](const uint32_t* dispositions, uint64_t count,
                                                                       uint64_t chunk, uint64_t chunks) {
        for (uint64_t j = 0; j < count; j++) {
            const bool partialFirst = j == 0 && chunk == 0 && !firstCached && startUnaligned;
            const bool partialLast = chunk == chunks - 1 && j == count - 1 && endUnaligned && !partialFirst;
            uint64_t bytes = page;
            if (partialFirst) {
                bytes = firstPageBytes;
            } else if (partialLast) {
                bytes = end - (endBoundary - page);
                RKAssert(bytes <= region.size, "RKUserProcess", "partial last page within the region");
            }
            charge(dispositions[j], bytes, dirty, swapped);
            if (partialFirst && pendingUnusedSharedRegion_) {
                RKMemoryRegion& pending = *pendingUnusedSharedRegion_;
                RKAssert(pending.end() == start, "RKUserProcess", "pending unused shared region ends here");
                const uint64_t shared = pending.end() - (pending.end() & ~(page - 1));
                RKAssert(shared <= pending.size, "RKUserProcess", "shared bytes within the pending region");
                charge(dispositions[j], shared, pending.dirtySize, pending.swappedSize);
                pendingUnusedSharedRegion_ = nullptr;
            }
            if (partialLast) {
                cachedDispositionAddress_ = endBoundary - page;
                cachedDisposition_ = dispositions[j];
            }
        }
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
                                               [&](const uint32_t* dispositions, uint64_t count, uint64_t chunk, uint64_t chunks) {
        for (uint64_t j = 0; j < count; j++) run.add(pageKind(dispositions[j], reclaimableBit));
        if (chunk == chunks - 1) run.add(RKPageKind::none);
    });
    // Runs of a region only partly read would undercount it: its counters stand instead.
    if (!queried) region.freeSubrangeList();
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
