// Who is charged for an owned object: its one owner alone, or, when several processes own it
// (a memfd whose descriptor several hold), each of them as for any memory they share.
#include <gtest/gtest.h>

#include "RKAnalysisTestSupport.h"
#include "model/RKMemoryObject.h"

namespace {

std::shared_ptr<RKMemoryRegion> owned(bool claimed, uint64_t dirty = 8192) {
    auto made = region(9, 0, 16384, dirty);
    made->ownedExclusivelyByParentProcess = claimed;
    return made;
}

// A process of the live system (the test processes stand for snapshots otherwise).
class RKLiveTestProcess : public RKTestProcess {
public:
    bool _isAlive() const override { return true; }
};

}  // namespace

// One owner charged alone is in RKObjectIdentityTest's golden journal; here, several owners.
TEST(RKOwnedByHoldersTest, SeveralOwnersShareTheObject) {
    ScopedSettings settings(true);
    auto a = makeProcess(10, {owned(true)}), b = makeProcess(20, {owned(true, 4096)}), c = makeProcess(30, {owned(false)});
    RKMemspread memspread({a, b, c});
    memspread.analyzeData();
    std::shared_ptr<RKMemoryObject> object = (*a->memoryRegions())[0]->memoryObject();
    EXPECT_EQ(object->ownerPid(), -1) << "no single owner";
    EXPECT_EQ(memspread.pidToMemspread().at(10), 8192u);
    EXPECT_EQ(memspread.pidToMemspread().at(20), 4096u);
    EXPECT_EQ(memspread.pidToMemspread().at(30), 8192u);
    EXPECT_EQ(object->totalDirtySize(), 8192u) << "counted once";
    EXPECT_EQ(object->viewForProcess(*b)->totalDirtySize(), 4096u) << "each holder sees its own charge";
}

// Segments nobody maps whose creator is gone are held by no process: one warning each, on the
// lowest-pid process shown, so that the report prints them once; without a live process shown
// the live system is not asked.
TEST(RKOwnedByHoldersTest, SegmentsOfGoneCreatorsWarnOnTheLowestShownProcess) {
    ScopedSettings settings(true);
    auto platform = std::make_shared<RKScriptedPlatform>();
    platform->addProcess(20, "alive");
    platform->segments = {{.shmid = 5, .size = 8192, .creator = 99, .attached = 0, .resident = 4096, .swapped = 4096},
                          {.shmid = 6, .size = 8192, .creator = 99, .attached = 1, .resident = 8192},
                          {.shmid = 7, .size = 8192, .creator = 20, .attached = 0, .resident = 8192}};
    RKScopedPlatform scope(platform);
    auto snapshot = makeProcess(20, {});
    RKMemspread({snapshot}).gatherData();
    EXPECT_EQ(platform->callCount("sysVSegments"), 0u);

    auto live = std::make_shared<RKLiveTestProcess>();
    live->setPid(30);
    live->setMemoryRegions(RKRegionList{});
    auto hidden = makeProcess(10, {}, true);
    RKMemspread memspread({live, snapshot, hidden});
    memspread.gatherData();
    EXPECT_EQ(snapshot->globalWarnings(), std::vector<std::string>{
        "SysV shared memory segment 5 holds 8192 bytes that no process maps: its creator [99] is gone"});
    EXPECT_TRUE(hidden->globalWarnings().empty() && live->globalWarnings().empty());
}
