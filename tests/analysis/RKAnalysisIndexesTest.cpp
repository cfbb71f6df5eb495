// The analysis's own indexes. Ranks are the keys' places in ascending order with no gaps: across
// words and chunks of the frame bitmap, repeated keys, and swap entries after every frame, whether
// one instance was given every key or several, each some, were joined. A set joined from two
// tries is the set one trie makes of the same members. Each pointer is new to the pointer set
// once, through the growths of its table.
#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

#include "analysis/RKPageKeyRanks.h"
#include "analysis/RKPointerSet.h"
#include "analysis/RKProcessSetTrie.h"
#include "platform/RKKernelTypes.h"

TEST(RKPageKeyRanks, RanksAreAscendingPlacesOfTheDistinctKeys) {
    const std::vector<uint64_t> keys = {RKSwappedPageKey | 7, 64, 5, 63, 32768, 32767, 1ull << 40, 5,
                                        RKSwappedPageKey | 2, 0, 64, (1ull << 40) + 1};
    std::vector<uint64_t> distinct = keys;
    std::sort(distinct.begin(), distinct.end());
    distinct.erase(std::unique(distinct.begin(), distinct.end()), distinct.end());
    // Split so that the parts share chunks, words and keys, and each has chunks of its own.
    for (size_t parts : {1, 2, 3}) {
        SCOPED_TRACE(parts);
        RKPageKeyRanks ranks;
        std::vector<RKPageKeyRanks> joined(parts - 1);
        for (size_t i = 0; i < keys.size(); i++) (i % parts == 0 ? ranks : joined[i % parts - 1]).add(keys[i]);
        for (RKPageKeyRanks& part : joined) ranks.addAll(std::move(part));
        ranks.seal();
        ASSERT_EQ(ranks.size(), distinct.size());
        RKPageKeyRanks::Reader reader(ranks);
        for (size_t i = 0; i < distinct.size(); i++) EXPECT_EQ(reader.rank(distinct[i]), i) << distinct[i];
    }
}

// Processes 0-3 met in one trie, 4-7 in another: each union, joined, is the node the first trie
// makes by adding the later members itself, whichever joins came before.
TEST(RKProcessSetTrie, JoinedSetsAreTheSetsOfTheirUnion) {
    const std::vector<std::vector<uint32_t>> sets = {
        {0, 1, 4, 5}, {0, 1, 4}, {1, 4, 5}, {0, 1, 4, 5}, {4, 5, 7}, {2}, {0, 1, 4, 5, 6}, {0, 1}, {4}, {}, {1, 4, 5}};
    RKProcessSetTrie early, late;
    RKProcessSetTrie::Joiner joiner(early, late);
    for (const std::vector<uint32_t>& members : sets) {
        uint32_t lower = RKProcessSetTrie::kEmpty, upper = RKProcessSetTrie::kEmpty;
        for (uint32_t p : members) (p < 4 ? lower : upper) = (p < 4 ? early : late).with(p < 4 ? lower : upper, p);
        const uint32_t set = joiner.join(lower, upper);
        EXPECT_EQ(early.members(set), members);
        // The same node as adding each later member to the earlier set in the first trie.
        uint32_t added = lower;
        for (uint32_t p : members)
            if (p >= 4) added = early.with(added, p);
        EXPECT_EQ(set, added);
    }
}

TEST(RKPointerSet, EachPointerIsNewOnceThroughGrowth) {
    std::vector<long> objects(5000);
    RKPointerSet set(10);
    for (const long& object : objects) EXPECT_TRUE(set.insert(&object));
    for (size_t i = 0; i < objects.size(); i += 7) EXPECT_FALSE(set.insert(&objects[i]));
    EXPECT_EQ(set.size(), objects.size());
}
