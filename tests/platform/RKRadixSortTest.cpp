// The radix sort agrees with a stable comparison sort whatever the number of digit passes the
// largest key needs (none, one, an odd or an even number).
#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <utility>
#include <vector>

#include "platform/RKRadixSort.h"

TEST(RKRadixSort, AgreesWithAStableSort) {
    std::mt19937_64 random(7);
    for (uint64_t largest : {uint64_t{0}, uint64_t{1000}, uint64_t{1} << 30, uint64_t{1} << 40, ~uint64_t{0}}) {
        std::vector<std::pair<uint64_t, int>> records;
        for (int i = 0; i < 5000; i++) records.push_back({largest ? random() % largest : 0, i});
        records.push_back({largest, -1});
        auto expected = records;
        std::stable_sort(expected.begin(), expected.end(), [](auto& a, auto& b) { return a.first < b.first; });
        RKRadixSortByKey(std::span(records), [](const auto& r) { return r.first; });
        EXPECT_EQ(records, expected) << largest;
    }
}
