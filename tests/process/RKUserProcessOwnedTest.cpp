// Owned memory of a live process on scripted kernel answers: the owned-object list, the charge
// of a region that maps an owned object, the regions of the objects no region maps, and the
// reduction of the kernel's owned-memory pseudo-region by what was found mapped.
#include <gtest/gtest.h>

#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxOwnedObjects.h"
#include "platform/RKLinuxTags.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint64_t P = 4096;
constexpr uint32_t kVolatile = VM_PURGABLE_VOLATILE << 4;
constexpr uint32_t kNotPurgeable = VM_PURGABLE_DENY << 4;

RKScriptedRegion mapping(uint64_t start, uint64_t pages, uint64_t objectId, RKRegionSubmapInfo info = {},
                         int purge = VM_PURGABLE_DENY) {
    RKScriptedRegion region;
    region.start = start;
    region.size = pages * P;
    region.purgeState = purge;
    region.info = info;
    region.info.user_tag = RKTagMemfd;
    region.info.object_id_full = objectId;
    return region;
}

RKOwnedVmObjectRecord record(uint64_t id, uint64_t resident, uint64_t compressed, uint32_t flags = kNotPurgeable) {
    return {.object_id = id, .virtual_size = 64 * P, .resident_size = resident, .wired_size = P,
            .reusable_size = P, .compressed_size = compressed, .flags = flags, .detail = "buffer"};
}

class RKUserProcessOwnedTest : public ::testing::Test {
protected:
    RKUserProcessOwnedTest() { platform->addProcess(7, "tool"); }
    void TearDown() override { RKAnalysisSettings::resetCache(); }

    RKScriptedProcess& tool() { return *platform->find(7); }
    const RKRegionList& gathered(bool breakDown = true) {
        platform->selfRegionValue = breakDown ? 1 : 0;
        RKAnalysisSettings::resetCache();
        testing::internal::CaptureStderr();
        process = std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(7));
        process->gatherData();
        printed = testing::internal::GetCapturedStderr();
        return *process->memoryRegions();
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::shared_ptr<RKUserProcess> process;
    std::string printed;
};

}  // namespace

// An object mapped twice and listed once is charged once, from its record; one nobody maps
// becomes a region without an address; a volatile one keeps only what is wired.
TEST_F(RKUserProcessOwnedTest, ListedObjectsAreChargedOnceFromTheirRecords) {
    tool().ownedErrno = 0;
    tool().regions = {mapping(0x10000, 4, 0x8000000000000011, {.pages_resident = 4, .pages_dirtied = 1}),
                      mapping(0x20000, 4, 0x8000000000000011, {.pages_resident = 4, .pages_dirtied = 4}),
                      mapping(0x30000, 2, 0x4000000000000033, {.pages_resident = 2, .pages_dirtied = 2})};
    tool().owned = {record(0x8000000000000011, 10 * P, 2 * P, kNotPurgeable | RKLedgerTagGraphics << 1),
                    record(0x8000000000000022, 6 * P, 3 * P), record(0x8000000000000044, 6 * P, 3 * P, kVolatile),
                    record(0x8000000000000055, 6 * P, 3 * P, kNotPurgeable | 1)};
    const RKRegionList& regions = gathered();
    ASSERT_EQ(regions.size(), 6u);

    const RKMemoryRegion& first = *regions[0];
    EXPECT_TRUE(first.ownedExclusivelyByParentProcess && first.name == "memfd (graphics)");
    EXPECT_EQ(first.dirtySize, 9 * P) << "resident less reusable";
    EXPECT_EQ(first.swappedSize, 2 * P);
    EXPECT_TRUE(first.cleanNonSpecSize == 0 && first.reclaimableSize == P);
    EXPECT_EQ(regions[1]->dirtySize + regions[1]->swappedSize, 0u) << "the object is already charged whole";
    EXPECT_EQ(regions[2]->dirtySize, 2 * P) << "not listed: its own counters";
    EXPECT_FALSE(regions[2]->ownedExclusivelyByParentProcess);

    std::map<uint64_t, const RKMemoryRegion*> leftovers;
    for (size_t i = 3; i < regions.size(); i++) leftovers[regions[i]->object_id] = regions[i].get();
    const RKMemoryRegion& unmapped = *leftovers.at(0x8000000000000022);
    EXPECT_EQ(unmapped.name + " " + unmapped.detailedName, "Owned physical memspread (unmapped) buffer");
    EXPECT_TRUE(unmapped.start == RKRegionNoAddress && unmapped.size == 64 * P && unmapped.share_mode == SM_SHARED);
    EXPECT_TRUE(unmapped.ownedExclusivelyByParentProcess && unmapped.wired && unmapped.isFake());
    EXPECT_EQ(unmapped.dirtySize, 5 * P);
    EXPECT_EQ(unmapped.swappedSize, 3 * P);
    const RKMemoryRegion &volatileOne = *leftovers.at(0x8000000000000044), &uncounted = *leftovers.at(0x8000000000000055);
    EXPECT_TRUE(volatileOne.dirtySize == P && volatileOne.swappedSize == 0) << "volatile: the wired bytes";
    EXPECT_EQ(uncounted.dirtySize + uncounted.swappedSize, 0u) << "marked as not counted";
}

// Without a list the pseudo-region holds the owned memory and is reduced by the purgeable
// memory found mapped; an empty list drops it; the breakdown off asks for nothing; a list that
// cannot be read is a warning.
TEST_F(RKUserProcessOwnedTest, PseudoRegionIsReducedByMappedOwnedMemoryAndAnUnreadableListWarns) {
    auto pseudo = mapping(0x90000, 4, 0, {.pages_resident = 3, .pages_swapped_out = 1, .pages_dirtied = 3});
    pseudo.info.user_tag = RK_OWNED_MEMORY_TAG;
    auto purgeable = mapping(0x10000, 4, 0x4000000000000010, {.pages_resident = 2, .pages_dirtied = 1},
                             VM_PURGABLE_NONVOLATILE);
    tool().regions = {purgeable, pseudo};

    const RKRegionList& reduced = gathered();
    ASSERT_EQ(reduced.size(), 2u);
    EXPECT_EQ(reduced[0]->dirtySize, 2 * P) << "clean folded into dirty";
    EXPECT_EQ(reduced[0]->cleanNonSpecSize, 0u);
    EXPECT_TRUE(reduced[1]->dirtySize == P && reduced[1]->swappedSize == P && process->warnings().empty());

    tool().regions[0].info.pages_resident = 6;  // more than the pseudo-region holds
    EXPECT_EQ(gathered().size(), 1u);
    EXPECT_EQ(process->warnings(), std::vector<std::string>{
        "tool [7]: Memspread changed while analyzing – unmapped owned physical memspread may be over-counted by "
        "8192 bytes"});

    tool().ownedErrno = 0;  // an empty list: the list accounts for everything
    EXPECT_EQ(gathered().size(), 1u);
    EXPECT_EQ(gathered()[0]->dirtySize, P) << "no list entry: the region's own counters";

    const size_t asked = platform->callCount("ownedVmObjects");
    gathered(false);
    EXPECT_EQ(platform->callCount("ownedVmObjects"), asked) << "breakdown off: no list";

    // Descriptors that cannot be read are a warning.
    tool().regions.pop_back();
    tool().ownedErrno = EACCES;
    gathered();
    EXPECT_EQ(process->warnings(), std::vector<std::string>{
        "tool [7]: descriptors cannot be read without root - memory held through them is not counted"});
    tool().ownedErrno = EIO;
    gathered();
    EXPECT_EQ(process->warnings(), std::vector<std::string>{"tool [7]: vm.get_owned_vmobjects - Input/output error"});
    EXPECT_EQ(printed, process->warnings()[0] + "\n");
}
