// Regions of all processes becoming memory objects, and what each process is charged for them,
// owned objects and SysV segments that no process holds among them.
#include <gtest/gtest.h>

#include "RKAnalysisTestSupport.h"
#include "model/RKMemoryObject.h"
#include "model/RKProcessGroup.h"
#include "platform/RKLinuxVmaClassifier.h"

namespace {

// A mapping of all 16K of object 9, `dirty` bytes of it dirty, the rest clean.
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

// A maps [0, 8K) of object 7 dirty; B maps the same pages and 4K more further on. The pages both
// map count once in the summary; each process is charged its own pages with the breakdown on and
// the whole object with it off; without sharing analysis no process has a view of its own.
TEST(RKObjectIdentityTest, SharedObjectCountsOnceInSummaryAndAsChargedPerProcess) {
    auto recorder = std::make_shared<RKRecordingFormatter>("F", false);
    const std::pair<bool, bool> modes[] = {{true, false}, {false, false}, {false, true}};
    for (auto [breakDown, sharingDisabled] : modes) {
        ScopedSettings settings(breakDown, sharingDisabled);
        report({makeProcess(10, {region(7, 0, 8192, 8192)}),
                makeProcess(20, {region(7, 0, 8192, 8192), region(7, 16384, 4096, 4096)})},
               {recorder});
    }
    EXPECT_EQ(recorder->journalText(), RKExpectedJournal("analysis-shared-object.txt"));
}

// Private ids are found within their process, processes side by side: two regions of one id are
// one object, listed once in the private group, and never another process's; processes whose
// pids carry the same bits (two snapshots of one process) still meet. A region without an object
// id, or with an invalid one, is an object of its own.
TEST(RKObjectIdentityTest, PrivateIdsMeetOnlyWhereTheirPidBitsDo) {
    ScopedSettings settings(false);
    auto privatePage = [](pid_t pid, uint64_t offset) {
        return region(RKPrivateObjectId(pid, 0x10000000, 4096), offset, 4096, 4096);
    };
    constexpr pid_t kSameBits = 30 + (1 << 22);
    auto p10 = makeProcess(10, {privatePage(10, 0), region(7, 0, 4096, 0), privatePage(10, 4096)});
    auto p20 = makeProcess(20, {privatePage(20, 0), region(7, 0, 4096, 0), region(0, 0, 4096, 0), region(0, 0, 4096, 0),
                                region(~0ull, 0, 4096, 0)});
    auto p30 = makeProcess(30, {privatePage(30, 0)});
    auto twin = makeProcess(kSameBits, {privatePage(kSameBits, 0)});
    RKMemspread memspread({p10, p20, p30, twin});
    memspread.analyzeData();
    auto objectOf = [](const auto& process, size_t i) { return (*process->memoryRegions())[i]->memoryObject(); };
    EXPECT_EQ(objectOf(p10, 0), objectOf(p10, 2));
    EXPECT_NE(objectOf(p10, 0), objectOf(p20, 0));
    EXPECT_EQ(objectOf(p30, 0), objectOf(twin, 0));
    EXPECT_EQ(memspread.pidToMemspread().at(10), 8192u);
    EXPECT_EQ(memspread.identityMaps()->uniqueMemoryObjects.size(), 3u);

    const RKProcessToGroupsMap groups = memspread._generateProcessToProcessGroups();
    const RKProcessGroup& own = *groups.at(10).front();
    EXPECT_EQ(own.count(), 1u);
    EXPECT_EQ(own.objects().size(), 1u);
    EXPECT_EQ(groups.at(30).front()->count(), 2u);
}

// B maps memory that A owns: with the breakdown on, B sees its dirty and swapped bytes as clean.
TEST(RKObjectIdentityTest, OwnedMemoryLooksCleanToOtherMappers) {
    ScopedSettings settings(true);
    auto swapping = [](bool claimed) {
        auto made = owned(claimed);
        made->swappedSize = 4096;
        made->cleanNonSpecSize = 4096;
        return made;
    };
    auto recorder = std::make_shared<RKRecordingFormatter>("F", false);
    report({makeProcess(10, {swapping(true)}), makeProcess(20, {swapping(false)})}, {recorder});
    EXPECT_EQ(recorder->journalText(), RKExpectedJournal("analysis-owned-memory.txt"));
}

// Who is charged for an owned object: its one owner alone (the golden journal above), or, when
// several processes own it (a memfd whose descriptor several hold), each of them as for any
// memory they share.
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
