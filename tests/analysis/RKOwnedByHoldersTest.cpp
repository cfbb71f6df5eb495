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

}  // namespace

TEST(RKOwnedByHoldersTest, OneOwnerIsChargedAloneAndSeveralShareTheObject) {
    ScopedSettings settings(true);
    {
        RKMemspread memspread({makeProcess(10, {owned(true)}), makeProcess(20, {owned(false)})});
        memspread.analyzeData();
        EXPECT_EQ(memspread.pidToMemspread().at(10), 8192u);
        EXPECT_EQ(memspread.pidToMemspread().at(20), 0u) << "a mapper of another's memory is not charged for it";
    }
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
