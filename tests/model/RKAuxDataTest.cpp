#include "model/RKAuxData.h"

#include <gtest/gtest.h>

namespace {

RKAuxNode leaf(int64_t value, bool aggregate) { return std::make_shared<RKAuxData>(value, aggregate); }
std::shared_ptr<RKAuxDataMap> map(RKAuxDataMap::Entries entries) { return std::make_shared<RKAuxDataMap>(entries); }

// The leaf under `key`, -999 when there is none.
int64_t valueAt(const std::shared_ptr<const RKAuxDataMap>& map, const std::string& key) {
    auto node = std::dynamic_pointer_cast<const RKAuxData>(map ? map->objectForKey(key) : nullptr);
    return node ? node->value() : -999;
}

}  // namespace

// The first operand's leaves decide what is summed, at every level; keys only in the second
// stand on their own terms; maps whose leaves all drop out drop out, at any depth.
TEST(RKAuxData, MergingKeepsWhatTheFirstOperandAggregates) {
    auto first = map({{"phys", leaf(5, true)}, {"peak", leaf(9, false)},
                      {"Maps", map({{"zones", leaf(10, true)}, {"counter", leaf(3, false)}})},
                      {"Quiet", map({{"only", leaf(4, false)}})}});
    auto second = map({{"phys", leaf(-3, true)}, {"peak", leaf(100, true)}, {"kept", leaf(7, true)},
                       {"dropped", leaf(8, false)},
                       {"Maps", map({{"zones", leaf(20, true)}, {"extra", leaf(1, true)}})},
                       {"Quiet", map({{"only", leaf(6, true)}})},
                       {"Late", map({{"inner", map({{"off", leaf(1, false)}})}})}});

    auto merged = first->mergeWithData(second);
    ASSERT_TRUE(merged);
    EXPECT_EQ(merged->count(), 3u);
    EXPECT_EQ(valueAt(merged, "phys"), 2);
    EXPECT_EQ(valueAt(merged, "kept"), 7);
    auto maps = std::dynamic_pointer_cast<const RKAuxDataMap>(merged->objectForKey("Maps"));
    ASSERT_TRUE(maps);
    EXPECT_EQ(maps->count(), 2u);
    EXPECT_EQ(valueAt(maps, "zones"), 30);
    EXPECT_EQ(valueAt(maps, "extra"), 1);
    EXPECT_EQ(valueAt(first, "phys"), 5) << "merging must not change its operands";

    EXPECT_EQ(map({{"a", leaf(1, false)}})->mergeWithData(map({{"a", leaf(1, true)}})), nullptr);
    // Sums wrap as two's complement (signed overflow would be undefined).
    EXPECT_EQ(valueAt(map({{"x", leaf(INT64_MAX, true)}})->mergeWithData(map({{"x", leaf(1, true)}})), "x"), INT64_MIN);
}
