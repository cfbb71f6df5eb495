#include "model/RKRangeList.h"

#include <gtest/gtest.h>

#include <array>
#include <random>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;

RKMemoryTotal dirty(uint64_t bytes) { return RKMemoryTotal{.dirty = bytes}; }
RKRangeListNode node(uint64_t location, uint64_t length, uint64_t dirtyBytes) {
    return RKRangeListNode{.location = location, .length = length, .dirty = dirtyBytes};
}

// The nodes after inserting {location, length, dirty bytes} ranges in order, with 4K pages.
std::vector<RKRangeListNode> nodesAfter(std::initializer_list<std::array<uint64_t, 3>> ranges) {
    RKRangeList list;
    for (auto [location, length, bytes] : ranges) list.addRange(location, length, kPage, dirty(bytes));
    return list.nodes();
}

}  // namespace

// Ranges whose page-rounded extents overlap or touch become one node; bytes the overlap shares
// are not counted twice. A range below the last node takes the queued path.
TEST(RKRangeList, MergesOverlappingAndTouchingRangesWithoutCountingTwice) {
    EXPECT_EQ(nodesAfter({{kPage, kPage, kPage}, {0, kPage, kPage}}), (std::vector{node(0, 2 * kPage, 2 * kPage)}));
    // Within one page the whole page overlaps: the larger size wins.
    EXPECT_EQ(nodesAfter({{200, 100, 100}, {0, 100, 100}}), (std::vector{node(0, 300, 100)}));
    EXPECT_EQ(nodesAfter({{0, 4 * kPage, 2 * kPage}, {0, 4 * kPage, 2 * kPage}}),
              (std::vector{node(0, 4 * kPage, 2 * kPage)}));
    // A range between two nodes bridges them.
    EXPECT_EQ(nodesAfter({{3 * kPage, kPage, kPage}, {0, kPage, kPage}, {kPage + 10, 2 * kPage - 20, 2 * kPage - 20}}),
              (std::vector{node(0, 4 * kPage, 4 * kPage - 20)}));
}

// Queued insertions are placed in batches when the list is read; that must give exactly the
// nodes of placing each insertion as it comes (reading after every one). Overlapping, touching,
// sub-page and empty ranges; ascending runs and random jumps; one page size or two mixed.
TEST(RKRangeList, BatchedPlacementMatchesPlacingEachInsertion) {
    std::mt19937_64 random(42);
    for (int trial = 0; trial < 120; ++trial) {
        RKRangeList batched, eager;
        uint64_t cursor = 0;
        for (int i = 0; i < 150; ++i) {
            uint64_t page = trial % 3 == 2 && random() % 2 ? 4 * kPage : kPage;
            uint64_t length = random() % 4 == 0 ? random() % 64 : random() % (3 * kPage);
            bool ascending = trial % 2 == 0 && random() % 8 != 0;
            uint64_t location = ascending ? cursor + random() % (2 * kPage) : random() % (64 * kPage * (1 + trial % 4));
            cursor = location + length;
            RKMemoryTotal sizes{.dirty = random() % (length + 1), .clean = random() % 512};
            for (RKRangeList* list : {&batched, &eager}) list->addRange(location, length, page, sizes);
            eager.nodeCount();
        }
        ASSERT_EQ(batched.nodes(), eager.nodes()) << "trial " << trial;
    }
}
