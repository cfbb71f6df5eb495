// The walk's regions made in blocks: each one fresh and its own, and alive for as long as it is
// held, whatever becomes of the other regions of its block and of their maker.
#include <gtest/gtest.h>

#include <memory>
#include <vector>

#include "model/RKMemoryRegion.h"
#include "model/RKMemoryTotal.h"
#include "process/RKRegionBlocks.h"

TEST(RKRegionBlocksTest, ARegionOutlivesItsMakerAndTheOthersOfItsBlock) {
    constexpr uint64_t kPage = 4096;
    std::shared_ptr<RKMemoryRegion> kept;
    std::shared_ptr<RKMemoryRegion> last;
    {
        RKRegionBlocks blocks;
        std::vector<std::shared_ptr<RKMemoryRegion>> made;
        for (uint64_t i = 0; i < RKRegionBlocks::kRegionsPerBlock + 2; i++) {
            made.push_back(blocks.make());
            EXPECT_EQ(made.back()->start, 0u);
            made.back()->start = (i + 1) * kPage;
            made.back()->addSubrange(i * kPage, kPage, RKMemoryTotal{.dirty = kPage}, kPage);
        }
        for (uint64_t i = 0; i < made.size(); i++) EXPECT_EQ(made[i]->start, (i + 1) * kPage);
        kept = made[3];
        last = made.back();
    }
    // Read and written with every other holder gone: AddressSanitizer sees a freed block, and
    // the leak check subranges that the blocks' regions did not free.
    EXPECT_EQ(kept->start, 4 * kPage);
    ASSERT_NE(kept->subrangeList(), nullptr);
    kept->addSubrange(0x100 * kPage, kPage, RKMemoryTotal{.clean = kPage}, kPage);
    kept.reset();
    EXPECT_EQ(last->start, (RKRegionBlocks::kRegionsPerBlock + 2) * kPage);
    EXPECT_NE(last->subrangeList(), nullptr);
}
