#include "model/RKRangeList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <vector>

#include "RKModelTestSupport.h"

namespace {

RKMemoryTotal dirty(uint64_t bytes) { return RKMemoryTotal{.dirty = bytes}; }
RKRangeListNode node(uint64_t location, uint64_t length, uint64_t dirtyBytes) {
    return RKRangeListNode{.location = location, .length = length, .dirty = dirtyBytes};
}

// The insertion as a plain walk over a sorted vector: the obvious quadratic form, against which
// the queued and replayed placement must give identical nodes.
struct WalkedList {
    std::vector<RKRangeListNode> nodes;

    void add(uint64_t location, uint64_t length, uint64_t page, const RKMemoryTotal& s) {
        auto down = [&](uint64_t v) { return v & ~(page - 1); };
        auto up = [&](uint64_t v) { return down(v + page - 1); };
        uint64_t lo = down(location), hi = up(location + length);
        RKRangeListNode fresh{location, length, s.clean, s.dirty, s.swapped, s.reclaimable, s.wired};
        size_t i = 0, j;
        while (i < nodes.size() && up(nodes[i].location + nodes[i].length) < lo) ++i;
        for (j = i; j < nodes.size() && down(nodes[j].location) <= hi; ++j) {
            const RKRangeListNode& m = nodes[j];
            uint64_t from = std::max(lo, down(m.location)), to = std::min(hi, up(m.location + m.length));
            uint64_t overlap = to > from ? to - from : 0;
            for (auto field : {&RKRangeListNode::clean, &RKRangeListNode::dirty, &RKRangeListNode::swapped,
                               &RKRangeListNode::reclaimable, &RKRangeListNode::wired}) {
                uint64_t a = fresh.*field, b = m.*field;
                fresh.*field = std::max(a + b > overlap ? a + b - overlap : 0, std::max(a, b));
            }
            uint64_t end = std::max(fresh.location + fresh.length, m.location + m.length);
            fresh.location = std::min(fresh.location, m.location);
            fresh.length = end - fresh.location;
        }
        nodes.erase(nodes.begin() + long(i), nodes.begin() + long(j));
        nodes.insert(nodes.begin() + long(i), fresh);
    }
};

}  // namespace

TEST(RKRangeList, MergesOverlappingAndTouchingRangesWithoutCountingTwice) {
    RKRangeList samePage, touching, inOnePage, halfDirty, bridged;
    samePage.addRange(0, kPage, kPage, dirty(kPage));
    samePage.addRange(0, kPage, kPage, dirty(kPage));
    EXPECT_EQ(samePage.nodes(), (std::vector{node(0, kPage, kPage)}));

    touching.addRange(kPage, kPage, kPage, dirty(kPage));  // below the last node: queued
    touching.addRange(0, kPage, kPage, dirty(kPage));
    EXPECT_EQ(touching.nodes(), (std::vector{node(0, 2 * kPage, 2 * kPage)}));

    inOnePage.addRange(200, 100, kPage, dirty(100));  // the whole page overlaps: the larger wins
    inOnePage.addRange(0, 100, kPage, dirty(100));
    EXPECT_EQ(inOnePage.nodes(), (std::vector{node(0, 300, 100)}));

    halfDirty.addRange(0, 4 * kPage, kPage, dirty(2 * kPage));
    halfDirty.addRange(0, 4 * kPage, kPage, dirty(2 * kPage));
    EXPECT_EQ(halfDirty.sum(), dirty(2 * kPage));

    bridged.addRange(3 * kPage, kPage, kPage, dirty(kPage));
    bridged.addRange(0, kPage, kPage, dirty(kPage));
    ASSERT_EQ(bridged.nodeCount(), 2u);
    bridged.addRange(kPage + 10, 2 * kPage - 20, kPage, dirty(2 * kPage - 20));
    EXPECT_EQ(bridged.nodes(), (std::vector{node(0, 4 * kPage, 4 * kPage - 20)}));
    EXPECT_EQ(RKRangeList().sum(), RKMemoryTotal{});
}

TEST(RKRangeList, DisjointRangesEndTheSameWhateverTheInsertionOrder) {
    std::vector<uint64_t> starts;
    for (uint64_t i = 0; i < 300; ++i) starts.push_back(i * 2 * kPage + i % 7);
    std::vector<RKRangeListNode> expected;
    for (uint64_t start : starts) expected.push_back(node(start, kPage - 7, start % 4096 + 1));
    std::mt19937_64 random(7);
    for (int round = 0; round < 3; ++round) {
        RKRangeList list;
        for (uint64_t start : starts) list.addRange(start, kPage - 7, kPage, dirty(start % 4096 + 1));
        EXPECT_EQ(list.nodes(), expected) << round;
        std::shuffle(starts.begin(), starts.end(), random);
    }
}

TEST(RKRangeList, AnyInsertionSequenceMatchesTheWalkedList) {
    // Overlapping, touching, sub-page and empty ranges; ascending runs and random jumps; reads
    // in between; one page size or two mixed.
    std::mt19937_64 random(42);
    for (int trial = 0; trial < 120; ++trial) {
        RKRangeList list;
        WalkedList walked;
        uint64_t cursor = 0;
        for (int i = 0; i < 150; ++i) {
            uint64_t page = trial % 3 == 2 && random() % 2 ? 4 * kPage : kPage;
            uint64_t length = random() % 4 == 0 ? random() % 64 : random() % (3 * kPage);
            bool ascending = trial % 2 == 0 && random() % 8 != 0;
            uint64_t location = ascending ? cursor + random() % (2 * kPage) : random() % (64 * kPage * (1 + trial % 4));
            cursor = location + length;
            RKMemoryTotal sizes{.dirty = random() % (length + 1), .swapped = random() % 512,
                                .clean = random() % (length + 1), .reclaimable = random() % 64,
                                .wired = random() % 2 ? length : 0};
            list.addRange(location, length, page, sizes);
            walked.add(location, length, page, sizes);
            if (random() % 25 == 0) {
                ASSERT_EQ(list.nodes(), walked.nodes) << "trial " << trial << " at " << i;
            }
        }
        ASSERT_EQ(list.nodes(), walked.nodes) << "trial " << trial;
    }
}
