#include "model/RKAuxData.h"

#include <gtest/gtest.h>

namespace {

RKAuxNode leaf(int64_t value, bool aggregate) { return std::make_shared<RKAuxData>(value, aggregate); }
std::shared_ptr<RKAuxDataMap> map(RKAuxDataMap::Entries entries) { return std::make_shared<RKAuxDataMap>(entries); }

int64_t valueAt(const std::shared_ptr<RKAuxDataMap>& map, const std::string& key) {
    auto node = std::dynamic_pointer_cast<const RKAuxData>(map ? map->objectForKey(key) : nullptr);
    return node ? node->value() : -999;
}

}  // namespace

TEST(RKAuxData, FirstOperandDecidesAndSecondOnlyKeysStandAlone) {
    auto process = map({{"phys", leaf(5, true)}, {"peak", leaf(9, false)}});
    auto global = map({{"phys", leaf(-3, true)}, {"peak", leaf(100, true)}, {"kept", leaf(7, true)},
                       {"dropped", leaf(8, false)}});

    auto merged = process->mergeWithData(global);
    ASSERT_TRUE(merged);
    EXPECT_EQ(valueAt(merged, "phys"), 2);
    // The second map's aggregating leaf does not rescue a key the first will not aggregate.
    EXPECT_FALSE(merged->objectForKey("peak"));
    EXPECT_EQ(valueAt(merged, "kept"), 7);
    EXPECT_FALSE(merged->objectForKey("dropped"));
    EXPECT_EQ(merged->count(), 2u);
    EXPECT_EQ(valueAt(process, "phys"), 5) << "merging must not change its operands";

    EXPECT_EQ(map({{"a", leaf(1, false)}})->mergeWithData(map({{"a", leaf(1, true)}})), nullptr);
    // Sums wrap as two's complement (signed overflow would be undefined).
    EXPECT_EQ(valueAt(map({{"x", leaf(INT64_MAX, true)}})->mergeWithData(map({{"x", leaf(1, true)}})), "x"), INT64_MIN);
}

TEST(RKAuxData, NestedMapsMergeLevelByLevelAndEmptiedOnesVanish) {
    auto first = map({{"Maps", map({{"zones", leaf(10, true)}, {"counter", leaf(3, false)}})},
                      {"Quiet", map({{"only", leaf(4, false)}})}});
    auto second = map({{"Maps", map({{"zones", leaf(20, true)}, {"extra", leaf(1, true)}})},
                       {"Quiet", map({{"only", leaf(6, true)}})},
                       {"Late", map({{"inner", map({{"off", leaf(1, false)}})}})}});

    auto merged = first->mergeWithData(second);
    ASSERT_TRUE(merged);
    EXPECT_EQ(merged->count(), 1u) << "maps whose leaves all drop out drop out, at any depth";
    auto json = merged->jsonRepresentation();
    ASSERT_EQ(json.members.size(), 1u);
    EXPECT_EQ(json.members[0].first, "Maps");
    const auto& maps = json.members[0].second.members;
    ASSERT_EQ(maps.size(), 2u);
    EXPECT_EQ(maps[0].first, "extra");  // key order
    EXPECT_EQ(maps[1].first, "zones");
    EXPECT_EQ(maps[1].second.number, 30);
}

TEST(RKAuxDataDeathTest, LeafMergedWithMapStops) {
    auto withLeaf = map({{"k", leaf(1, true)}});
    auto withMap = map({{"k", map({{"x", leaf(1, true)}})}});
    EXPECT_DEATH(withLeaf->mergeWithData(withMap), "!datum2 \\|\\| datum1.isContainer == datum2.isContainer");
    EXPECT_DEATH(withMap->mergeWithData(withLeaf), "datum1.isContainer == datum2.isContainer");
}
