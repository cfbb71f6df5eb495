// Interned region names: one entry per distinct string, freed with its last handle, counted
// correctly when several threads intern and drop handles at once.
#include "model/RKInternedString.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

namespace {

TEST(RKInternedString, EqualStringsShareOneEntryUntilTheLastHandleGoes) {
    const size_t before = RKInternedString::entryCount();
    {
        RKInternedString a = std::string("/usr/lib/libtest-share.so");
        RKInternedString b(std::string_view("/usr/lib/libtest-share.so"));
        RKInternedString other("/usr/lib/libtest-other.so");
        EXPECT_EQ(a.c_str(), b.c_str());
        EXPECT_TRUE(a == b && a != other && a == "/usr/lib/libtest-share.so");
        EXPECT_EQ(RKInternedString::entryCount(), before + 2);

        RKInternedString copied = a;
        RKInternedString moved = std::move(b);
        EXPECT_EQ(a.useCount(), 3u);
        copied = other;  // leaves one entry, joins the other
        moved = "";
        EXPECT_TRUE(moved.empty() && moved.useCount() == 0);
        EXPECT_EQ(std::pair(a.useCount(), other.useCount()), std::pair(size_t{1}, size_t{2}));
    }
    EXPECT_EQ(RKInternedString::entryCount(), before);
}

// Gathering workers name regions in parallel.
TEST(RKInternedString, GatheringThreadsInterningAndDroppingKeepCountsExact) {
    constexpr int kThreads = 4;
    constexpr int kRounds = 20000;
    const size_t before = RKInternedString::entryCount();
    std::vector<std::vector<RKInternedString>> kept(kThreads);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; t++) {
        threads.emplace_back([t, &kept] {
            const std::string own = "thread " + std::to_string(t);
            for (int i = 0; i < kRounds; i++) {
                kept[t].emplace_back("shared by all");
                kept[t].emplace_back(own);
                // No handle outlives the round: the entry is freed and made again, racing the
                // other threads' lookups of the same string.
                RKInternedString passing("passing through");
                RKInternedString copy = passing;
            }
        });
    }
    for (auto& thread : threads) thread.join();

    EXPECT_EQ(kept[0][0].useCount(), size_t{kThreads} * kRounds);
    for (int t = 0; t < kThreads; t++) EXPECT_EQ(kept[t][1].useCount(), size_t{kRounds});
    EXPECT_EQ(RKInternedString::entryCount(), before + 1 + kThreads);
    kept.clear();
    EXPECT_EQ(RKInternedString::entryCount(), before);
}

}  // namespace
