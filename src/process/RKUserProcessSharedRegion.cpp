// The shared region: the kernel describes the shared library cache as a few large mappings, but
// the memory in them belongs to hundreds of image segments that every process shares. Each
// mapping is cut into one region per image segment and one per gap between segments, so that
// the analysis can tell them apart by address and segment kind.
#include <algorithm>

#include "model/RKMemoryRegion.h"
#include "process/RKImage.h"
#include "process/RKUserProcess.h"

namespace {

constexpr const char* kUnusedAreaName = "unused lodr shared cache area";
constexpr const char* kLinkeditDetail = "lodr shared cache";

bool neverPrivate(uint8_t segment) { return segment == RKSegmentText || segment == RKSegmentLinkedit; }

// A piece of the mapping [mappingStart, ...) described by `info`, with its identity.
std::shared_ptr<RKMemoryRegion> piece(RKRegionBlocks& blocks, uint64_t start, uint64_t end, uint64_t mappingStart,
                                      const RKRegionSubmapInfo& info) {
    auto region = blocks.make();
    region->start = start;
    region->setEnd(end);
    region->user_tag = info.user_tag;
    region->object_id = info.object_id_full;
    region->share_mode = info.share_mode;
    region->offset = info.offset - mappingStart + start;
    region->inSharedCache = true;
    region->wired = info.user_wired_count != 0;
    return region;
}

}  // namespace

bool RKUserProcess::_addRegionsToArray(RKRegionWalkState& state, uint64_t start, uint64_t size,
                                       const RKRegionSubmapInfo& info) {
    pendingUnusedSharedRegion_ = nullptr;
    const uint64_t end = start + size;
    const uint64_t page = pageSize();
    const uint64_t align = sharedRegionAlignmentSize_ ? sharedRegionAlignmentSize_ : page;
    auto pageOf = [page](uint64_t address) { return address & ~(page - 1); };
    auto next = [&](uint64_t from) {
        return state.imageEnumerator ? state.imageEnumerator->nextImageForStart(from, end) : nullptr;
    };
    std::shared_ptr<RKImage> image = next(start);
    std::shared_ptr<RKImage> previous;
    uint64_t cursor = start;

    while (cursor < end) {
        // A gap before the next image segment (or to the end of the mapping).
        if (!image || cursor < image->start) {
            auto unused = piece(state.regionBlocks, cursor, image ? std::min(image->start, end) : end, start, info);
            unused->name = kUnusedAreaName;
            unused->unusedSharedCacheRegion = true;
            // The gap belongs with the segment whose page it shares.
            if (previous && pageOf(previous->end()) == pageOf(cursor))
                unused->segment = previous->segment;
            else if (image && pageOf(image->start) == pageOf(unused->end()))
                unused->segment = image->segment;
            else
                unused->segment = RKSegmentUnset;
            if (!neverPrivate(unused->segment) && (pageOf(unused->start) != unused->start || pageOf(unused->end()) != unused->end()) &&
                !_populateMemoryRegionWithPageQueries(*unused, info))
                return false;
            cursor = unused->end();
            state.regions.push_back(std::move(unused));
            if (cursor >= end || !image) return true;
        }

        // The image segment, up to the end of the mapping.
        uint64_t pieceEnd = std::min(image->end(), end);
        std::shared_ptr<RKImage> following = next(pieceEnd);
        const uint64_t pieceStart = std::max(image->start, cursor);
        // Segments laid out at the alignment own the rest of their last aligned block.
        if (following != image && pieceStart % align == 0 && (following ? following->start : 0) % align == 0)
            pieceEnd = std::min(end, (pieceEnd + align - 1) / align * align);
        if (pieceEnd <= pieceStart) {  // an empty segment: nothing of it to report
            if (following == image) return true;
            image = std::move(following);
            continue;
        }
        auto region = piece(state.regionBlocks, pieceStart, pieceEnd, start, info);
        region->name = image->name();
        region->detailedName = image->segment == RKSegmentLinkedit ? kLinkeditDetail : image->ownerPath();
        region->segment = image->segment;
        // Code and link-edit data are never written: only the other segments can hold private pages.
        if (!neverPrivate(region->segment) && !_populateMemoryRegionWithPageQueries(*region, info)) return false;
        cursor = region->end();
        state.regions.push_back(std::move(region));
        previous = std::move(image);
        image = std::move(following);
    }
    return true;
}
