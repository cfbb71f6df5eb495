// Shared anonymous pages as the platform keeps them. The packed list gives back exactly the
// records it was given, in key order, across every width of difference (equal keys, one byte,
// several, the jump to swap entries at the top bit) and of range index. The radix sort that
// orders a process's pages agrees with a stable comparison sort whatever the number of digit
// passes the largest key needs (none, one, an odd or an even number).
#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <utility>
#include <vector>

#include "platform/RKRadixSort.h"
#include "platform/RKSharedPageList.h"

namespace {

using Record = std::pair<uint64_t, uint32_t>;

std::vector<Record> unpacked(const RKSharedPageList& list) {
    std::vector<Record> records;
    for (const RKSharedAnonymousPage& page : list) records.emplace_back(page.page(), page.range);
    return records;
}

}  // namespace

TEST(RKSharedPageList, GivesBackTheRecordsInKeyOrder) {
    std::mt19937_64 random(11);
    for (uint32_t largestRange : {uint32_t{UINT16_MAX}, UINT32_MAX}) {  // ranges in two bytes, or four
        SCOPED_TRACE(largestRange);
        std::vector<RKSharedAnonymousPage> pages;
        uint64_t frame = 0;
        for (int i = 0; i < 3000; i++) {
            frame += random() % 4 == 0 ? 0 : uint64_t{1} << (random() % 40);
            pages.emplace_back(frame, static_cast<uint32_t>(random() % (uint64_t{largestRange} + 1) >> (random() % 32)));
        }
        pages.emplace_back(RKSwappedPageKey | 5, largestRange);
        pages.emplace_back(~uint64_t{0}, 0);
        std::shuffle(pages.begin(), pages.end(), random);  // sorted by the list itself

        std::vector<Record> expected;
        for (const auto& page : pages) expected.emplace_back(page.page(), page.range);
        std::sort(expected.begin(), expected.end());

        RKSharedPageList list(pages);
        EXPECT_EQ(list.size(), pages.size());
        std::vector<Record> actual = unpacked(list);
        EXPECT_TRUE(std::is_sorted(actual.begin(), actual.end(), [](auto& a, auto& b) { return a.first < b.first; }));
        std::sort(actual.begin(), actual.end());  // equal keys may come in any order of their ranges
        EXPECT_EQ(actual, expected);
        EXPECT_LT(list.capacity(), pages.size() * sizeof(RKSharedAnonymousPage));

        list.release();
        EXPECT_TRUE(list.empty());
        EXPECT_EQ(list.capacity(), 0u);
        EXPECT_TRUE(unpacked(list).empty());
    }
    EXPECT_TRUE(unpacked(RKSharedPageList()).empty());
}

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
