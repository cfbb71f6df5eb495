// Processes on scripted kernel answers: how a command line selects them (name and pid lookup,
// descendants, exclusions, hidden extra targets, -s), and how the region walk of a live process
// turns entries into regions (sizes, names, identity), ends, and reports failures.
#include <gtest/gtest.h>

#include <array>
#include <cstring>

#include "driver/RKMemspreadArgs.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxTags.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKKeptArgv.h"

namespace {

using Keys = std::vector<int64_t>;
constexpr uint64_t P = 4096;

// An entry of `pages` pages at `start` answering the counters of `info` and purge state `purge`;
// with a 64-bit object id made from its address.
RKScriptedRegion entry(uint64_t start, uint64_t pages, RKRegionSubmapInfo info = {}, int purge = VM_PURGABLE_DENY) {
    RKScriptedRegion region;
    region.start = start;
    region.size = pages * P;
    region.purgeState = purge;
    region.info = info;
    region.info.object_id_full = 0x4000000000000000ull | start;
    region.info.object_id = static_cast<uint32_t>(start);
    return region;
}

// Dirty, reclaimable, swapped and clean non-speculative bytes.
using Sizes = std::array<uint64_t, 4>;
Sizes sizes(const RKMemoryRegion& r) { return {r.dirtySize, r.reclaimableSize, r.swappedSize, r.cleanNonSpecSize}; }

class RKProcessTest : public ::testing::Test {
protected:
    RKProcessTest() {
        platform->addProcess(0, "kernel", 0, PROC_FLAG_SYSTEM);
        platform->addProcess(1, "init", 0);
        platform->addProcess(7, "tool");
        platform->selfPid = 600;
    }
    void TearDown() override { RKAnalysisSettings::resetCache(); }

    RKScriptedProcess& tool() { return *platform->find(7); }
    // Makes and gathers the tool, with or without the breakdown; `printed` is what it wrote.
    std::shared_ptr<RKUserProcess> gathered(bool breakDown = false) {
        platform->selfRegionValue = breakDown ? 1 : 0;
        RKAnalysisSettings::resetCache();
        testing::internal::CaptureStderr();
        auto process = std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(7));
        if (process) process->gatherData();
        printed = testing::internal::GetCapturedStderr();
        return process;
    }

    // Resolves a command line (without the program name): the keys of its visible (or hidden)
    // targets; `printed` is what resolving wrote.
    Keys targets(std::vector<std::string> arguments, bool hidden = false, RKError* error = nullptr) {
        std::vector<char*> argv = RKKeptArgv(std::move(arguments));
        auto args = RKMemspreadArgs::initWithArgc(static_cast<int>(argv.size() - 1), argv.data());
        testing::internal::CaptureStderr();
        auto map = args.value().targetProcessesAndError(error);
        printed = testing::internal::GetCapturedStderr();
        Keys keys;
        for (const auto& [key, process] : map.value_or(RKTargetMap{}))
            if (process->hiddenFromDisplay() == hidden) keys.push_back(key);
        return keys;
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::string printed;
};

}  // namespace

TEST_F(RKProcessTest, NumberStopsTheWalkUnlessItsProcessBearsTheName) {
    platform->addProcess(3, "42");
    platform->addProcess(42, "other");
    platform->addProcess(50, "42");
    EXPECT_EQ(*RKProcess::pidsForStringDescriptions({"42"}, nullptr), (RKPidNameMap{{3, "42"}, {42, std::nullopt}}));
    std::strcpy(platform->find(42)->info.pbi_comm, "42");
    EXPECT_EQ(*RKProcess::pidsForStringDescriptions({"42"}, nullptr),
              (RKPidNameMap{{3, "42"}, {42, "42"}, {50, "42"}}));

    auto found = RKProcess::pidsForStringDescriptions({" +3", "50abc", "init"}, nullptr);
    EXPECT_EQ(*found, (RKPidNameMap{{1, "init"}, {3, std::nullopt}, {50, std::nullopt}}));
    std::vector<std::string> errors;
    platform->listFails = true;
    EXPECT_FALSE(RKProcess::pidsForStringDescriptions({"init"}, &errors));
    EXPECT_EQ(errors, std::vector<std::string>{"Unable to obtain system process list"});
}

TEST_F(RKProcessTest, DescendantsGenerationByGenerationEachOnce) {
    platform->addProcess(2, "a", 1);
    platform->addProcess(3, "grandchild", 2);
    platform->addProcess(4, "b", 1);
    platform->addProcess(9, "great", 3);
    platform->addProcess(600, "memspread", 3);
    // The kernel is its own parent and init's: every process once, generation by generation.
    EXPECT_EQ(*RKProcess::childPidsForPids({0}), (std::vector<pid_t>{0, 1, 7, 2, 4, 3, 9, 600}));
    // Descendants join after the exclusions, so an excluded one is measured, memspread included.
    EXPECT_EQ(targets({"-t", "0", "-x", "great"}), (Keys{0, 1, 2, 3, 4, 7, 9, 600}));
}

TEST_F(RKProcessTest, UnmappedHiddenTargetsAndIdleExitFilter) {
    platform->addProcess(5, "named");
    platform->addProcess(6, "dirty").dirtyFlags = 0x7;  // tracked, may exit when idle, but dirty
    platform->addProcess(8, "clean").dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    platform->addProcess(9, "excluded");
    platform->addProcess(600, "memspread");
    EXPECT_EQ(targets({"--unmapped", "named", "-x", "excluded"}, true), (Keys{1, 6, 7, 8}))
        << "hidden: not the kernel, the exclusions or memspread";
    EXPECT_EQ(targets({"--unmapped", "-s", "named"}, true), (Keys{1, 6, 7, 9}));
    EXPECT_EQ(targets({"-a", "-s"}), (Keys{0, 1, 5, 6, 7, 9}));
}

TEST_F(RKProcessTest, ErrorsAndUnanalyzableTargets) {
    platform->addProcess(5, "worker").taskResult = KERN_PROTECTION_FAILURE;
    RKError error;
    EXPECT_EQ(targets({"nothing", "tool", "worker", "--pid", "77", "Tool"}, false, &error), Keys{7})
        << "unresolved names leave the others";
    EXPECT_EQ(error.localizedDescription, "Unable to find pid for process matching 'Tool'\n"
                                          "Unable to find pid for process matching 'nothing'");
    EXPECT_EQ(printed, "task_for_pid: permission denied\n"
                       "Unable to analyze process worker [5] (try as root?)\n"
                       "Unable to analyze process with pid 77 (try as root?)\n");
}

TEST_F(RKProcessTest, EntriesBecomeNamedRegionsOnce) {
    auto memfd = entry(0x40000, 2, {.user_tag = RKTagMemfd});
    memfd.path = "buffer";  // the platform's detail of a tagged region, not a file path
    memfd.count = 18;       // an older record without the 64-bit object id
    auto unreadable = entry(0x30000, 4, {.external_pager = 1});  // a file whose path cannot be read
    tool().regions = {entry(0x10000, 4), unreadable, memfd};

    auto process = gathered();
    const auto& list = *process->memoryRegions();
    ASSERT_EQ(list.size(), 3u);
    EXPECT_EQ(list[0]->object_id, 0x4000000000010000ull);
    EXPECT_EQ(list[1]->fullName(), "mapped file") << "no path, no detail";
    EXPECT_EQ(list[2]->fullName(), "memfd buffer") << "a detail does not make a region a mapped file";
    EXPECT_EQ(list[2]->object_id, 0x40000u) << "18 words: the 32-bit id stands in";

    size_t walkCalls = platform->callCount("regionRecurse");
    process->gatherData();
    EXPECT_EQ(platform->callCount("regionRecurse"), walkCalls) << "a second gather reads nothing";
    EXPECT_EQ(printed, "");
}

TEST_F(RKProcessTest, SizesFollowPurgeStateAndBreakdown) {
    tool().regions = {
        entry(0x10000, 8, {.pages_resident = 3, .pages_dirtied = 3}, VM_PURGABLE_EMPTY),
        entry(0x20000, 8, {.pages_resident = 3, .pages_dirtied = 3}, VM_PURGABLE_VOLATILE),
        entry(0x30000, 8,
              {.pages_resident = 6, .pages_swapped_out = 2, .pages_dirtied = 1, .user_wired_count = 1,
               .pages_reusable = 2}),
        entry(0x40000, 8, {.pages_resident = 5, .pages_dirtied = 2, .external_pager = 1, .pages_reusable = 1}),
        // Counters read at different moments may overlap: nothing goes below 0.
        entry(0x50000, 8, {.pages_resident = 2, .pages_dirtied = 2, .pages_reusable = 3}),
    };
    for (bool breakDown : {false, true}) {
        SCOPED_TRACE(breakDown ? "breakdown on" : "breakdown off");
        auto process = gathered(breakDown);
        const auto& list = *process->memoryRegions();
        ASSERT_EQ(list.size(), 5u);
        EXPECT_EQ(sizes(*list[0]), (Sizes{0, 8 * P, 0, 0})) << "emptied: all of it reclaimable";
        EXPECT_EQ(sizes(*list[1]), (Sizes{0, 3 * P, 0, 0})) << "volatile: what is resident";
        // Anonymous: without the breakdown every resident page that is not reusable is dirty.
        EXPECT_EQ(sizes(*list[2]), breakDown ? (Sizes{1 * P, 2 * P, 2 * P, 3 * P}) : (Sizes{4 * P, 2 * P, 2 * P, 0}));
        EXPECT_TRUE(list[2]->wired);
        EXPECT_EQ(sizes(*list[3]), (Sizes{2 * P, 1 * P, 0, 2 * P})) << "files count what was dirtied";
        EXPECT_EQ(sizes(*list[4]), (Sizes{breakDown ? 2 * P : 0, 3 * P, 0, 0}));
    }
}

TEST_F(RKProcessTest, OwnedPseudoRegionEndsTheWalkAndPageTablesFollowIt) {
    auto pseudo = entry(0x20000, 4, {.user_tag = RK_OWNED_MEMORY_TAG, .pages_resident = 3, .pages_dirtied = 3});
    pseudo.info.object_id_full = 0;
    tool().regions = {entry(0x10000, 1), pseudo, entry(0x30000, 1)};
    tool().ledgerBalances = {3 * static_cast<int64_t>(P)};
    EXPECT_EQ(gathered()->memoryRegions()->size(), 2u) << "no page table without the breakdown";

    auto process = gathered(true);
    const auto& list = *process->memoryRegions();
    ASSERT_EQ(list.size(), 3u) << "nothing after the pseudo-region is examined";
    EXPECT_EQ(list[1]->fullName(), "Owned physical memspread (unmapped)");
    EXPECT_EQ(list[1]->start, RKRegionNoAddress) << "owned but unmapped: no address";
    EXPECT_EQ(sizes(*list[1]), (Sizes{3 * P, 0, 0, 0}));
    EXPECT_EQ(list[1]->object_id, 0x20000u) << "no 64-bit id: the 32-bit one";
    EXPECT_EQ(list[2]->fullName(), "page table");
    EXPECT_EQ(sizes(*list[2]), (Sizes{3 * P, 0, 0, 0}));
    EXPECT_EQ(list[2]->object_id, ~0ull);

    tool().ledgerBalances = {-5};
    EXPECT_EQ(gathered(true)->memoryRegions()->size(), 2u) << "a negative balance is no page table";
    tool().ledgerErrno = EPERM;
    const std::string warning = "tool [7]: Unable to retrieve ledger entry info - Operation not permitted";
    EXPECT_EQ(gathered(true)->warnings(), std::vector<std::string>{warning});
    EXPECT_EQ(printed, warning + "\n");
}

TEST_F(RKProcessTest, FailedWalkKeepsRegionsAndTellsExitFromError) {
    tool().regions = {entry(0x10000, 2), entry(0x20000, 2)};
    tool().walkEnd = MACH_SEND_INVALID_DEST;
    tool().shortStatusErrno = ESRCH;
    auto exited = gathered();
    EXPECT_EQ(exited->memoryRegions()->size(), 2u) << "the regions found before stay";
    EXPECT_EQ(exited->warnings(), std::vector<std::string>{"tool [7]: process is gone (process exited)"});
    EXPECT_TRUE(exited->errors().empty());
    EXPECT_EQ(printed, "mach_vm_region_recurse: process is gone\n"
                       "bailing out for process tool [7]; data may be incomplete!\n");

    tool().shortStatusErrno = 0;
    tool().shortStatus = SZOMB;
    EXPECT_EQ(gathered()->warnings(), std::vector<std::string>{"tool [7]: process is gone (zombie)"});
    tool().shortStatus = 2;  // still running: the same answer is an error
    EXPECT_EQ(gathered()->errors(), std::vector<std::string>{"tool [7]: process is gone"});
    tool().walkEnd = KERN_FAILURE;
    EXPECT_EQ(gathered()->errors(), std::vector<std::string>{"tool [7]: failure"});
}
