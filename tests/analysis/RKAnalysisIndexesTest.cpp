// The analysis's own indexes. Ranks are the keys' places in ascending order with no gaps: across
// words and chunks of the frame bitmap, repeated keys, and swap entries after every frame. Each
// pointer is new to the pointer set once, through the growths of its table.
#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

#include "analysis/RKPageKeyRanks.h"
#include "analysis/RKPointerSet.h"
#include "platform/RKKernelTypes.h"

TEST(RKPageKeyRanks, RanksAreAscendingPlacesOfTheDistinctKeys) {
    const std::vector<uint64_t> keys = {RKSwappedPageKey | 7, 64, 5, 63, 32768, 32767, 1ull << 40, 5,
                                        RKSwappedPageKey | 2, 0, 64, (1ull << 40) + 1};
    RKPageKeyRanks ranks;
    for (uint64_t key : keys) ranks.add(key);
    ranks.seal();
    std::vector<uint64_t> distinct = keys;
    std::sort(distinct.begin(), distinct.end());
    distinct.erase(std::unique(distinct.begin(), distinct.end()), distinct.end());
    ASSERT_EQ(ranks.size(), distinct.size());
    RKPageKeyRanks::Reader reader(ranks);
    for (size_t i = 0; i < distinct.size(); i++) EXPECT_EQ(reader.rank(distinct[i]), i) << distinct[i];
}

TEST(RKPointerSet, EachPointerIsNewOnceThroughGrowth) {
    std::vector<long> objects(5000);
    RKPointerSet set(10);
    for (const long& object : objects) EXPECT_TRUE(set.insert(&object));
    for (size_t i = 0; i < objects.size(); i += 7) EXPECT_FALSE(set.insert(&objects[i]));
    EXPECT_EQ(set.size(), objects.size());
}
