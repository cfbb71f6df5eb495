#include "process/RKRegionBlocks.h"

#include "model/RKMemoryRegion.h"

namespace {

// Constructed whole, by std::make_shared: the block and its control block are one allocation.
struct RKRegionBlock {
    RKMemoryRegion regions[RKRegionBlocks::kRegionsPerBlock];
};

}  // namespace

std::shared_ptr<RKMemoryRegion> RKRegionBlocks::make() {
    if (next_ == end_) {
        auto block = std::make_shared<RKRegionBlock>();
        next_ = block->regions;
        end_ = next_ + kRegionsPerBlock;
        block_ = std::move(block);
    }
    return std::shared_ptr<RKMemoryRegion>(block_, next_++);
}
