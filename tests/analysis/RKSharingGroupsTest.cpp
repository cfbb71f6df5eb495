// Memory sorted by the exact set of processes that map it.
#include <gtest/gtest.h>

#include <set>
#include <tuple>

#include "RKAnalysisTestSupport.h"

// 10 and 20 share objects 3 and 6, and each has memory of its own; 30 shares all it maps with 40.
// Hidden 5 maps object 3 too, memory that 10 owns without mapping it (object 9), and object 8
// alone: it joins a group only through object 9, and object 8 stays out of the summary.
TEST(RKSharingGroupsTest, PrivateGroupFirstThenOneGroupPerSetOfSharers) {
    ScopedSettings settings(true);
    auto ownedUnmapped = region(9, 0, 4096, 4096);
    ownedUnmapped->start = RKRegionNoAddress;
    ownedUnmapped->user_tag = RKFakeRegionTag;
    ownedUnmapped->ownedExclusivelyByParentProcess = true;
    auto file = region(6, 0, 4096, 0);
    file->detailedName = "/lib/a.so";
    auto recorder = std::make_shared<RKRecordingFormatter>("F", false);
    report({makeProcess(5, {region(3, 0, 4096, 0), region(9, 0, 4096, 0), region(8, 0, 8192, 8192)}, true),
            makeProcess(10, {region(1, 0, 4096, 4096), region(3, 0, 4096, 0), ownedUnmapped, file}),
            makeProcess(20, {region(3, 0, 4096, 0), region(2, 0, 8192, 8192), region(6, 0, 4096, 0)}),
            makeProcess(30, {region(4, 0, 4096, 0)}),
            makeProcess(40, {region(4, 0, 4096, 0), region(5, 0, 4096, 4096)})},
           {recorder});
    EXPECT_EQ(recorder->journalText(), RKExpectedJournal("analysis-sharing-groups.txt"));
}

// A group of 26 or more whose objects look alike to every member computes its categories once;
// one whose owner sees the memory differently from the others never shares them.
TEST(RKSharingGroupsTest, LargeGroupsShareOneCategoryComputation) {
    const std::tuple<size_t, bool, size_t> cases[] = {{25, false, 25}, {26, false, 1}, {26, true, 26}};
    for (auto [members, owned, computations] : cases) {  // and the category computations expected
        SCOPED_TRACE(testing::Message() << members << (owned ? " owned" : ""));
        ScopedSettings settings(true);
        RKProcessList processes;
        for (size_t i = 0; i < members; i++) {
            auto mapping = region(1, 0, 8192, 8192);
            // The owner has the highest pid, so it is printed first: its view is the object itself.
            mapping->ownedExclusivelyByParentProcess = owned && i + 1 == members;
            processes.push_back(makeProcess(static_cast<pid_t>(100 + i), {mapping}));
        }
        auto recorder = std::make_shared<RKRecordingFormatter>();
        report(processes, {recorder});
        std::set<const void*> made;
        for (const auto& call : recorder->callsNamed("printSharedCategories")) made.insert(call.categoriesIdentity());
        EXPECT_EQ(made.size(), computations);
    }
}
