// Memory sorted by the exact set of processes that map it.
#include <gtest/gtest.h>

#include <span>

#include "RKAnalysisTestSupport.h"
#include "analysis/RKBatchEnumeration.h"
#include "model/RKMemoryObject.h"
#include "model/RKProcessGroup.h"

namespace {

std::vector<pid_t> membersOf(const RKProcessGroup& group) {
    std::vector<pid_t> pids;
    for (const auto& member : group.processes()) pids.push_back(member->pid());
    return pids;
}

// An owned, unmapped piece of object `objectId` (it has no address).
std::shared_ptr<RKMemoryRegion> ownedUnmapped(uint64_t objectId) {
    auto made = region(objectId, 0, 4096, 4096, "owned");
    made->start = RKRegionNoAddress;
    made->user_tag = RKFakeRegionTag;
    made->ownedExclusivelyByParentProcess = true;
    return made;
}

}  // namespace

TEST(RKSharingGroupsTest, PrivateGroupFirstThenOneInternedGroupPerSetOfSharers) {
    ScopedSettings settings(true);
    auto a = makeProcess(10, {region(1, 0, 4096, 0), region(3, 0, 4096, 0)});
    auto b = makeProcess(20, {region(3, 0, 4096, 0), region(2, 0, 4096, 0), region(3, 0, 4096, 0)});
    auto c = makeProcess(30, {region(4, 0, 4096, 0)});
    auto d = makeProcess(40, {region(4, 0, 4096, 0), region(5, 0, 4096, 0)});
    RKMemspread memspread(processList(a, b, c, d));
    memspread.analyzeData();
    RKProcessToGroupsMap groups = memspread._generateProcessToProcessGroups();

    ASSERT_EQ(groups[10].size(), 2u);
    ASSERT_EQ(groups[20].size(), 2u);
    EXPECT_EQ(membersOf(*groups[10][0]), std::vector<pid_t>{10});
    EXPECT_EQ(membersOf(*groups[20][0]), std::vector<pid_t>{20});
    EXPECT_EQ(groups[10][1], groups[20][1]);  // one instance for the set {10, 20}
    EXPECT_EQ(membersOf(*groups[10][1]), (std::vector<pid_t>{10, 20}));
    ASSERT_EQ(groups[10][1]->objects().size(), 1u);
    EXPECT_EQ(groups[10][1]->objects()[0], (*a->memoryRegions())[1]->memoryObject());
    // 30 shares all it maps: no private group; 40's private group is put before the shared one.
    ASSERT_EQ(groups[30].size(), 1u);
    EXPECT_EQ(membersOf(*groups[30][0]), (std::vector<pid_t>{30, 40}));
    ASSERT_EQ(groups[40].size(), 2u);
    EXPECT_EQ(membersOf(*groups[40][0]), std::vector<pid_t>{40});
}

// A hidden process joins a group only as a mapper of memory a shown process owns unmapped, and
// memory that only hidden processes reach stays out of the summary.
TEST(RKSharingGroupsTest, HiddenProcessJoinsOnlyThroughOwnedUnmappedMemory) {
    for (bool breakDown : {true, false}) {
        SCOPED_TRACE(breakDown);
        ScopedSettings settings(breakDown);
        auto shown = makeProcess(10, {ownedUnmapped(5), region(6, 0, 4096, 4096)});
        auto hidden = makeProcess(
            5, {region(5, 0, 4096, 0, "mapped owned"), region(6, 0, 4096, 0), region(8, 0, 8192, 8192)}, true);
        auto recorder = std::make_shared<RKRecordingFormatter>();
        auto memspread = report(processList(hidden, shown), {recorder});

        auto headers = recorder->callsNamed("printProcessHeader");
        ASSERT_EQ(headers.size(), 1u);
        EXPECT_EQ(memspread->pidToMemspread().count(5), 0u);
        auto shared = recorder->callsNamed("printSharedCategories");
        auto own = recorder->callsNamed("printProcessCategories");
        ASSERT_EQ(own.size(), 1u);
        if (breakDown) {
            ASSERT_EQ(shared.size(), 1u);
            EXPECT_EQ(shared[0].groupPids, (std::vector<pid_t>{5, 10}));
            EXPECT_EQ(shared[0].categories.count("mapped owned"), 1u);
            EXPECT_EQ(own[0].categories.count("shared"), 1u);
        } else {
            EXPECT_TRUE(shared.empty());
            EXPECT_EQ(own[0].categories.size(), 2u);
        }
        EXPECT_EQ(recorder->callsNamed("printSummaryCategories")[0].total.dirty, 8192u);
    }
}

TEST(RKSharingGroupsTest, BatchesCoverTheSequenceInSlicesOfAtMostTheBatchSize) {
    std::vector<int> items(600);
    auto slices = [&](size_t count, size_t batchSize) {
        std::vector<size_t> sizes;
        const int* expected = items.data();
        rk_enumerateObjectsWithBatchSize(std::span<const int>(items.data(), count), batchSize,
                                         [&](const int* first, size_t n) {
                                             EXPECT_EQ(first, expected);
                                             expected += n;
                                             sizes.push_back(n);
                                         });
        return sizes;
    };
    EXPECT_EQ(slices(600, 256), (std::vector<size_t>{256, 256, 88}));
    EXPECT_EQ(slices(3, 0), (std::vector<size_t>{1, 1, 1}));
    EXPECT_EQ(slices(512, 256), (std::vector<size_t>{256, 256}));
    EXPECT_TRUE(slices(0, 256).empty());
}
