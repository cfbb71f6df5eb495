// Each pointer is new once, through the growths of the table.
#include <gtest/gtest.h>

#include <vector>

#include "analysis/RKPointerSet.h"

TEST(RKPointerSet, EachPointerIsNewOnceThroughGrowth) {
    std::vector<long> objects(5000);
    RKPointerSet set(10);
    for (const long& object : objects) EXPECT_TRUE(set.insert(&object));
    for (size_t i = 0; i < objects.size(); i += 7) EXPECT_FALSE(set.insert(&objects[i]));
    EXPECT_EQ(set.size(), objects.size());
}
