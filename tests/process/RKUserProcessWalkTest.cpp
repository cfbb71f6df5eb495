// The region walk of a live user process on scripted kernel answers: how entries become
// regions (sizes, names, identity), how the walk ends, and how failures are reported.
#include <gtest/gtest.h>

#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxTags.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint64_t P = 4096;

RKScriptedRegion entry(uint64_t start, uint64_t pages, uint32_t tag = RKTagAnonymous) {
    RKScriptedRegion region;
    region.start = start;
    region.size = pages * P;
    region.info.user_tag = tag;
    region.info.share_mode = SM_PRIVATE;
    region.info.object_id_full = 0x4000000000000000ull | start;
    region.info.object_id = static_cast<uint32_t>(start);
    return region;
}

class RKUserProcessWalkTest : public ::testing::Test {
protected:
    void SetUp() override { RKAnalysisSettings::resetCache(); }
    void TearDown() override { RKAnalysisSettings::resetCache(); }

    RKScriptedProcess& script() { return *platform->find(7); }
    void setBreakDown(bool on) {
        platform->selfRegionValue = on ? 1 : 0;
        RKAnalysisSettings::resetCache();
    }
    // A gathered process; its regions by start, with `stderrText` what it printed.
    std::shared_ptr<RKUserProcess> gathered() {
        auto process = std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(7));
        testing::internal::CaptureStderr();
        if (process) process->gatherData();
        stderrText = testing::internal::GetCapturedStderr();
        return process;
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::string stderrText;

public:
    RKUserProcessWalkTest() { platform->addProcess(7, "tool"); }
};

}  // namespace

TEST_F(RKUserProcessWalkTest, EntriesBecomeNamedRegionsOnce) {
    auto& regions = script().regions;
    regions.push_back(entry(0x10000, 4));
    auto file = entry(0x20000, 4);
    file.info.external_pager = 1;
    file.path = "/usr/lib/libc.so";
    regions.push_back(file);
    file.start = 0x30000;
    file.path.reset();  // a file whose path cannot be read
    regions.push_back(file);
    auto memfd = entry(0x40000, 2, RKTagMemfd);
    memfd.path = "buffer";  // the platform's detail of a tagged region, not a file path
    memfd.count = 18;       // an older record without the 64-bit object id
    regions.push_back(memfd);

    auto process = gathered();
    ASSERT_TRUE(process && process->memoryRegions());
    const auto& list = *process->memoryRegions();
    ASSERT_EQ(list.size(), 4u);
    EXPECT_EQ(list[0]->fullName(), "anonymous");
    EXPECT_EQ(list[0]->segment, RKSegmentNoImage);
    EXPECT_EQ(list[0]->object_id, 0x4000000000010000ull);
    EXPECT_EQ(list[1]->name, "mapped file");
    EXPECT_EQ(list[1]->detailedName, "/usr/lib/libc.so");
    EXPECT_EQ(list[2]->name, "mapped file");
    EXPECT_EQ(list[2]->detailedName, "") << "no path, no detail";
    EXPECT_EQ(list[3]->name, "memfd") << "a detail does not make a region a mapped file";
    EXPECT_EQ(list[3]->detailedName, "buffer");
    EXPECT_EQ(list[3]->object_id, 0x40000u) << "18 words: the 32-bit id stands in";

    size_t walkCalls = platform->callCount("regionRecurse");
    EXPECT_EQ(walkCalls, 5u) << "four entries and the end";
    const RKMemoryRegion* first = list[0].get();
    process->gatherData();
    EXPECT_EQ(platform->callCount("regionRecurse"), walkCalls) << "a second gather reads nothing";
    EXPECT_EQ(process->memoryRegions()->front().get(), first);
    EXPECT_TRUE(process->errors().empty());
    EXPECT_EQ(stderrText, "");
}

TEST_F(RKUserProcessWalkTest, SizesFollowPurgeStateAndBreakdown) {
    auto emptied = entry(0x10000, 8);
    emptied.purgeState = VM_PURGABLE_EMPTY;
    emptied.info.pages_resident = 3;
    emptied.info.pages_dirtied = 3;
    auto volatileEntry = emptied;
    volatileEntry.start = 0x20000;
    volatileEntry.purgeState = VM_PURGABLE_VOLATILE;
    auto anonymous = entry(0x30000, 8);
    anonymous.info.pages_resident = 6;
    anonymous.info.pages_reusable = 2;
    anonymous.info.pages_dirtied = 1;
    anonymous.info.pages_swapped_out = 2;
    anonymous.info.user_wired_count = 1;
    auto file = entry(0x40000, 8);
    file.info.external_pager = 1;
    file.info.pages_resident = 5;
    file.info.pages_dirtied = 2;
    file.info.pages_reusable = 1;
    auto overlapping = entry(0x50000, 8);
    overlapping.info.pages_resident = 2;
    overlapping.info.pages_dirtied = 2;
    overlapping.info.pages_reusable = 3;
    script().regions = {emptied, volatileEntry, anonymous, file, overlapping};

    struct Sizes {
        uint64_t dirty, reclaimable, swapped, clean;
        bool operator==(const Sizes&) const = default;
    };
    auto sizes = [](const RKMemoryRegion& r) { return Sizes{r.dirtySize, r.reclaimableSize, r.swappedSize, r.cleanNonSpecSize}; };
    for (bool breakDown : {false, true}) {
        SCOPED_TRACE(breakDown ? "breakdown on" : "breakdown off");
        setBreakDown(breakDown);
        auto process = gathered();
        const auto& list = *process->memoryRegions();
        ASSERT_EQ(list.size(), 5u);
        EXPECT_EQ(sizes(*list[0]), (Sizes{0, 8 * P, 0, 0})) << "emptied: all of it reclaimable";
        EXPECT_EQ(sizes(*list[1]), (Sizes{0, 3 * P, 0, 0})) << "volatile: what is resident";
        // Anonymous: without the breakdown every resident page that is not reusable is dirty.
        EXPECT_EQ(sizes(*list[2]), breakDown ? (Sizes{1 * P, 2 * P, 2 * P, 3 * P}) : (Sizes{4 * P, 2 * P, 2 * P, 0}));
        EXPECT_TRUE(list[2]->wired);
        EXPECT_EQ(sizes(*list[3]), (Sizes{2 * P, 1 * P, 0, 2 * P})) << "files count what was dirtied";
        // Counters read at different moments may overlap: nothing goes below 0.
        EXPECT_EQ(list[4]->dirtySize, breakDown ? 2 * P : 0);
        EXPECT_EQ(list[4]->cleanNonSpecSize, 0u);
    }
}

TEST_F(RKUserProcessWalkTest, OwnedPseudoRegionEndsTheWalkAndLandsLast) {
    auto pseudo = entry(0x20000, 4, RK_OWNED_MEMORY_TAG);
    pseudo.info.pages_resident = 3;
    pseudo.info.pages_dirtied = 3;
    pseudo.info.object_id_full = 0;
    script().regions = {entry(0x10000, 1), pseudo, entry(0x30000, 1)};
    setBreakDown(true);
    auto process = gathered();
    const auto& list = *process->memoryRegions();
    ASSERT_EQ(list.size(), 2u) << "nothing after the pseudo-region is examined";
    EXPECT_EQ(list[0]->start, 0x10000u);
    EXPECT_EQ(list[1]->start, RKRegionNoAddress) << "owned but unmapped: no address";
    EXPECT_EQ(list[1]->dirtySize, 3 * P);
    EXPECT_EQ(list[1]->object_id, 0x20000u) << "no 64-bit id: the 32-bit one";
    EXPECT_EQ(list[1]->name, "Owned physical memspread (unmapped)");
}

TEST_F(RKUserProcessWalkTest, PageTableRegionComesFromTheLedger) {
    script().regions = {entry(0x10000, 1)};
    script().ledgerBalances = {3 * static_cast<int64_t>(P)};
    auto off = gathered();
    EXPECT_EQ(off->memoryRegions()->size(), 1u);
    EXPECT_EQ(platform->callCount("ledgerEntries"), 0u) << "no ledgers without the breakdown";

    setBreakDown(true);
    auto on = gathered();
    ASSERT_EQ(on->memoryRegions()->size(), 2u);
    const auto& table = *on->memoryRegions()->back();
    EXPECT_EQ(table.name, "page table");
    EXPECT_EQ(table.start, RKRegionNoAddress);
    EXPECT_EQ(table.size, 3 * P);
    EXPECT_EQ(table.dirtySize, 3 * P);
    EXPECT_EQ(table.object_id, ~0ull);
    EXPECT_EQ(table.share_mode, SM_PRIVATE);

    script().ledgerBalances = {-5};
    EXPECT_EQ(gathered()->memoryRegions()->size(), 1u) << "a negative balance is no page table";
    script().ledgerErrno = EPERM;
    testing::internal::CaptureStderr();
    auto failed = std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(7));
    std::string printed = testing::internal::GetCapturedStderr();
    const std::string warning = "tool [7]: Unable to retrieve ledger entry info - Operation not permitted";
    EXPECT_EQ(failed->warnings(), std::vector<std::string>{warning});
    EXPECT_EQ(printed, warning + "\n");
}

TEST_F(RKUserProcessWalkTest, FailedWalkKeepsRegionsAndTellsExitFromError) {
    script().regions = {entry(0x10000, 2), entry(0x20000, 2)};
    struct Case {
        kern_return_t code;
        int shortErrno;
        uint32_t status;
        std::string message;
        bool warning;
    };
    const Case cases[] = {
        {MACH_SEND_INVALID_DEST, ESRCH, 0, "tool [7]: process is gone (process exited)", true},
        {MACH_SEND_INVALID_DEST, 0, SZOMB, "tool [7]: process is gone (zombie)", true},
        {MACH_SEND_INVALID_DEST, 0, 2, "tool [7]: process is gone", false},  // still running
        {KERN_FAILURE, ESRCH, 0, "tool [7]: failure", false},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.message);
        script().walkEnd = c.code;
        script().shortStatusErrno = c.shortErrno;
        script().shortStatus = c.status;
        auto process = gathered();
        ASSERT_TRUE(process->memoryRegions());
        EXPECT_EQ(process->memoryRegions()->size(), 2u) << "the regions found before stay";
        EXPECT_EQ(c.warning ? process->warnings() : process->errors(), std::vector<std::string>{c.message});
        EXPECT_TRUE((c.warning ? process->errors() : process->warnings()).empty());
        EXPECT_EQ(stderrText, std::string("mach_vm_region_recurse: ") + mach_error_string(c.code) +
                                  "\nbailing out for process tool [7]; data may be incomplete!\n");
    }
}

namespace {

// Records what the shared-region and owned-object steps are handed.
class RKSteppedProcess : public RKUserProcess {
public:
    std::vector<std::pair<uint64_t, RKRegionSubmapInfo>> sharedEntries;
    bool splitSucceeds = true;
    std::optional<RKOwnedVmObjectMap> owned;
    int imageReads = 0;

    bool _addRegionsToArray(RKRegionWalkState&, uint64_t start, uint64_t, const RKRegionSubmapInfo& info) override {
        sharedEntries.emplace_back(start, info);
        return splitSucceeds;
    }
    std::optional<RKOwnedVmObjectMap> _gatherOwnedVmObjects() override { return owned; }
    void _gatherImageData() override { imageReads++; }
};

}  // namespace

TEST_F(RKUserProcessWalkTest, SharedRegionIsReadAtTheTopLevelAndSkippedWhenHidden) {
    platform->sharedRegion = true;  // arm64: [0x180000000, 0x280000000)
    auto shared = entry(0x190000000, 16);
    shared.basic.protection = VM_PROT_READ;
    shared.basic.offset = 0x5000;
    auto pseudo = entry(0x300001000, 1, RK_OWNED_MEMORY_TAG);
    pseudo.info.pages_resident = pseudo.info.pages_dirtied = 1;
    script().regions = {entry(0x100000000, 1), shared, entry(0x300000000, 1), pseudo};

    for (bool hidden : {false, true}) {
        SCOPED_TRACE(hidden ? "hidden" : "shown");
        auto process = std::make_shared<RKSteppedProcess>();
        ASSERT_TRUE(process->initWithBsdInfo(script().info));
        process->setHiddenFromDisplay(hidden);
        // An empty list accounts for all owned memory: the pseudo-region goes. A hidden process
        // reads no list, so its pseudo-region stays.
        process->owned = RKOwnedVmObjectMap{};
        process->gatherData();
        EXPECT_EQ(process->imageReads, hidden ? 0 : 1);
        const auto& list = *process->memoryRegions();
        ASSERT_EQ(list.size(), hidden ? 3u : 2u);
        EXPECT_EQ(list[1]->start, 0x300000000u);
        if (hidden) {
            EXPECT_TRUE(process->sharedEntries.empty());
            continue;
        }
        ASSERT_EQ(process->sharedEntries.size(), 1u);
        const auto& [start, info] = process->sharedEntries[0];
        EXPECT_EQ(start, 0x190000000u);
        EXPECT_EQ(info.protection, VM_PROT_READ);
        EXPECT_EQ(info.offset, 0x5000u);
        EXPECT_EQ(info.share_mode, SM_COW);
        EXPECT_EQ(info.object_id_full, 1u);
        EXPECT_EQ(info.external_pager, 1);
    }

    auto failing = std::make_shared<RKSteppedProcess>();
    ASSERT_TRUE(failing->initWithBsdInfo(script().info));
    failing->splitSucceeds = false;
    testing::internal::CaptureStderr();
    failing->gatherData();
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "bailing out for process tool [7]; data may be incomplete!\n");
    EXPECT_EQ(failing->memoryRegions()->size(), 1u) << "a failed split ends the walk";
}
