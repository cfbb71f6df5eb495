// Processes on scripted kernel answers: how a command line selects them (name and pid lookup,
// descendants, exclusions, hidden extra targets), a pid reused under it, and how the region walk
// of a live process turns entries into regions (sizes, names, images, identity, owned objects),
// ends, and reports failures.
#include "RKScriptedToolTest.h"

#include <array>
#include <cstring>
#include <tuple>

#include "driver/RKMemspreadArgs.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxOwnedObjects.h"
#include "platform/RKLinuxTags.h"
#include "support/RKKeptArgv.h"

namespace {

using Keys = std::vector<int64_t>;
constexpr uint64_t P = 4096;

// An entry of `pages` pages at `start` answering the counters of `info`, with an object id made
// from its address.
RKScriptedRegion entry(uint64_t start, uint64_t pages, RKRegionSubmapInfo info = {}) {
    RKScriptedRegion region;
    region.start = start;
    region.size = pages * P;
    region.info = info;
    region.info.object_id_full = 0x4000000000000000ull | start;
    return region;
}

// A memfd mapping of object `id`, and an owned-object record of one with a "buffer" detail.
RKScriptedRegion memfd(uint64_t start, uint64_t pages, uint64_t id, RKRegionSubmapInfo info) {
    RKScriptedRegion region = entry(start, pages, info);
    region.info.user_tag = RKTagMemfd;
    region.info.object_id_full = id;
    return region;
}
RKOwnedVmObjectRecord record(uint64_t id, uint64_t resident, uint64_t compressed,
                             uint32_t flags = VM_PURGABLE_DENY << 4) {
    return {.object_id = id, .virtual_size = 64 * P, .resident_size = resident, .wired_size = P,
            .reusable_size = P, .compressed_size = compressed, .flags = flags, .detail = "buffer"};
}

// Dirty, reclaimable, swapped and clean non-speculative bytes.
using Sizes = std::array<uint64_t, 4>;
Sizes sizes(const RKMemoryRegion& r) { return {r.dirtySize, r.reclaimableSize, r.swappedSize, r.cleanNonSpecSize}; }

class RKProcessTest : public RKScriptedToolTest {
protected:
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

TEST_F(RKProcessTest, UnmappedAddsEveryOtherProcessHidden) {
    platform->addProcess(5, "named");
    platform->addProcess(9, "excluded");
    platform->addProcess(600, "memspread");
    EXPECT_EQ(targets({"--unmapped", "named", "-x", "excluded"}, true), (Keys{1, 7}))
        << "hidden: not the kernel, the exclusions or memspread";
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

TEST_F(RKProcessTest, EntriesBecomeNamedRegions) {
    auto memfd = entry(0x40000, 2, {.user_tag = RKTagMemfd});
    memfd.path = "buffer";  // the platform's detail of a tagged region, not a file path
    auto unreadable = entry(0x30000, 4, {.external_pager = 1});  // a file whose path cannot be read
    tool().regions = {entry(0x10000, 4), unreadable, memfd};

    auto process = gathered();
    const auto& list = *process->memoryRegions();
    ASSERT_EQ(list.size(), 3u);
    EXPECT_EQ(list[0]->object_id, 0x4000000000010000ull);
    EXPECT_EQ(list[1]->fullName(), "mapped file") << "no path, no detail";
    EXPECT_EQ(list[2]->fullName(), "memfd buffer") << "a detail does not make a region a mapped file";
    EXPECT_EQ(printed, "");
}

// Images, out of order as the Linux platform lists them, name the file regions they hold.
TEST_F(RKProcessTest, ImagesNameTheRegionsTheyHold) {
    RKRegionSubmapInfo file;
    file.external_pager = 1;
    for (uint64_t start : {0x10000, 0x12000, 0x14000, 0x20000})
        tool().regions.push_back({start, 0x2000, file, RK_REGION_SUBMAP_INFO_COUNT, VM_PURGABLE_DENY, "/bin/tool", {}});
    tool().images = {{"/bin/tool", 0x10000, 0x14000, 0x2000, ".data", RKSegmentData},
                     {"/bin/tool", 0x10000, 0x10000, 0x2000, ".text", RKSegmentText},
                     {"/bin/tool", 0x10000, 0x12000, 0x2000, ".rodata", RKSegmentLinkedit}};
    auto process = gathered();
    std::vector<std::tuple<std::string, uint8_t, std::string>> regions;
    for (const auto& region : *process->memoryRegions())
        regions.emplace_back(region->name, region->segment, region->detailedName);
    EXPECT_EQ(regions, (std::vector<std::tuple<std::string, uint8_t, std::string>>{
                           {".text", RKSegmentText, "/bin/tool"},
                           {".rodata", RKSegmentLinkedit, "/bin/tool"},
                           {".data", RKSegmentData, "/bin/tool"},
                           {"mapped file", RKSegmentNoImage, "/bin/tool"}}));  // of no image segment
    EXPECT_FALSE(process->images()) << "images are dropped after the walk";
}

TEST_F(RKProcessTest, SizesFollowTheBreakdown) {
    tool().regions = {
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
        ASSERT_EQ(list.size(), 3u);
        // Anonymous: without the breakdown every resident page that is not reusable is dirty.
        EXPECT_EQ(sizes(*list[0]), breakDown ? (Sizes{1 * P, 2 * P, 2 * P, 3 * P}) : (Sizes{4 * P, 2 * P, 2 * P, 0}));
        EXPECT_TRUE(list[0]->wired);
        EXPECT_EQ(sizes(*list[1]), (Sizes{2 * P, 1 * P, 0, 2 * P})) << "files count what was dirtied";
        EXPECT_EQ(sizes(*list[2]), (Sizes{breakDown ? 2 * P : 0, 3 * P, 0, 0}));
    }
}

// The page tables are a region of their own, from the ledger, with the breakdown only.
TEST_F(RKProcessTest, PageTablesComeFromTheLedger) {
    tool().regions = {entry(0x10000, 1)};
    tool().ledgerBalances = {3 * static_cast<int64_t>(P)};
    EXPECT_EQ(gathered()->memoryRegions()->size(), 1u) << "no page table without the breakdown";
    auto process = gathered(true);
    const auto& list = *process->memoryRegions();
    ASSERT_EQ(list.size(), 2u);
    EXPECT_EQ(list[1]->fullName(), "page table");
    EXPECT_EQ(sizes(*list[1]), (Sizes{3 * P, 0, 0, 0}));
    EXPECT_EQ(list[1]->object_id, ~0ull);

    tool().ledgerBalances = {-5};
    EXPECT_EQ(gathered(true)->memoryRegions()->size(), 1u) << "a negative balance is no page table";
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

// An object mapped twice and listed once is charged once, from its record; one nobody maps
// becomes a region without an address.
TEST_F(RKProcessTest, ListedObjectsAreChargedOnceFromTheirRecords) {
    tool().ownedErrno = 0;
    tool().regions = {memfd(0x10000, 4, 0x8000000000000011, {.pages_resident = 4, .pages_dirtied = 1}),
                      memfd(0x20000, 4, 0x8000000000000011, {.pages_resident = 4, .pages_dirtied = 4}),
                      memfd(0x30000, 2, 0x4000000000000033, {.pages_resident = 2, .pages_dirtied = 2})};
    tool().owned = {record(0x8000000000000011, 10 * P, 2 * P, VM_PURGABLE_DENY << 4 | RKLedgerTagGraphics << 1),
                    record(0x8000000000000022, 6 * P, 3 * P)};
    auto process = gathered(true);
    const RKRegionList& regions = *process->memoryRegions();
    ASSERT_EQ(regions.size(), 4u);

    // Owned, name, dirty, swapped, clean and reclaimable bytes.
    auto row = [](const RKMemoryRegion& r) {
        return std::tuple(r.ownedExclusivelyByParentProcess, r.fullName(), r.dirtySize, r.swappedSize,
                          r.cleanNonSpecSize, r.reclaimableSize);
    };
    EXPECT_EQ(row(*regions[0]), std::tuple(true, "memfd (graphics)", 9 * P, 2 * P, 0u, P)) << "resident less reusable";
    EXPECT_EQ(row(*regions[1]), std::tuple(true, "memfd", 0u, 0u, 0u, 0u)) << "the object is already charged whole";
    EXPECT_EQ(row(*regions[2]), std::tuple(false, "memfd", 2 * P, 0u, 0u, 0u)) << "not listed: its own counters";
    const RKMemoryRegion& unmapped = *regions[3];
    EXPECT_EQ(row(unmapped), std::tuple(true, "Owned physical memspread (unmapped) buffer", 5 * P, 3 * P, 0u, P));
    EXPECT_TRUE(unmapped.start == RKRegionNoAddress && unmapped.size == 64 * P && unmapped.share_mode == SM_SHARED);
    EXPECT_TRUE(unmapped.wired && unmapped.isFake());
}

// The breakdown off asks for no list; a ledger or a list that cannot be read is a warning, also
// printed unless it only says that root is needed (a notice printed once per run says so).
TEST_F(RKProcessTest, TheListIsAskedWithTheBreakdownOnlyAndUnreadableFiguresWarn) {
    tool().regions = {entry(0x10000, 4, {.pages_resident = 2, .pages_dirtied = 1})};
    gathered(false);
    EXPECT_EQ(platform->callCount("ownedVmObjects"), 0u);
    const std::tuple<int, int, std::string> cases[] = {  // ledger errno, list errno, warning
        {EPERM, ENOENT, "Unable to retrieve ledger entry info - Operation not permitted"},
        {0, EACCES, "descriptors cannot be read without root - memory held through them is not counted"},
        {0, EIO, "vm.get_owned_vmobjects - Input/output error"}};
    for (const auto& [ledger, list, warning] : cases) {
        tool().ledgerErrno = ledger;
        tool().ownedErrno = list;
        EXPECT_EQ(gathered(true)->warnings(), std::vector<std::string>{"tool [7]: " + warning});
        if (list != EACCES) {
            EXPECT_EQ(printed, "tool [7]: " + warning + "\n");
        }
    }
}
