// A live process measured end to end: the fixture maps one area of each kind and forks a child
// that shares the shared kinds (of the memfd, each wrote one half). Gathered in this process,
// each area must come out as a region of the right name, detail, share mode, identity and size,
// its locked and lazily freed pages as the kernel counts them; through the binary, the report
// must show the shared kinds once, in the block of memory the two processes share, each process
// at the kernel's own figure and the anonymous memory they share since the fork once, and the
// JSON document of the same run must parse and agree with it.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <filesystem>

#include "RKKernelFigures.h"
#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"
#include "support/RKUnprivileged.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// The region of the gathered `process` at the fixture's area `name`; an empty one when none is.
const RKMemoryRegion& regionAt(const RKProcess& process, const RKFixtureProcess& fixture, const std::string& name) {
    static const RKMemoryRegion none;
    uint64_t address = fixture.area(name).value_or(RKFixtureArea{}).address;
    for (const auto& region : process.memoryRegions().value_or(RKRegionList{}))
        if (region->start <= address && address < region->end()) return *region;
    return none;
}

// Prints "PID MEMSPREAD" per process object in pid order, then "shared PID PID..." per shared
// record, its pids in order.
const char* kSummarizeDocument = R"(import json, sys
document = json.load(open(sys.argv[1], encoding="utf-8"))
for process in sorted(document["processes"], key=lambda p: p["pid"]): print(process["pid"], process.get("memspread"))
for record in document["shared"]: print("shared", *sorted(record["pids"]))
)";

// The process ends after its walk, before its page data is read.
class RKExitsAfterWalk : public RKUserProcess {
public:
    void enumerateRegions(const RKRegionCallback& callback) override {
        RKUserProcess::enumerateRegions(callback);
        ::kill(pid(), SIGTERM);  // the fixture removes its files on the way out
        ::waitpid(pid(), nullptr, 0);
    }
};

}  // namespace

TEST(RKUserProcessFixture, EveryKindOfMappingBecomesItsRegion) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    RKAnalysisSettings::setBreakDownPhysMemspread(true);  // the program's default, left on
    auto parent = RKProcess::processWithPid(fixture.pid()), child = RKProcess::processWithPid(fixture.childPid());
    ASSERT_TRUE(parent && child);
    parent->gatherData();
    child->gatherData();

    const std::string files = "memspread-fixture-" + std::to_string(fixture.pid());
    const struct {
        const char* area;
        const char* name;
        std::string detail;  // a suffix of the detailed name
        uint8_t shareMode;
        uint64_t dirtyPages;
        bool sharedWithChild;  // one object in both, which private anonymous memory never is
    } expectations[] = {
        {"memfd", "memfd", "memspread-fixture", SM_SHARED, 16, true},  // the child wrote the other half
        {"shared_anon", "shared anonymous", "", SM_SHARED, 16, true},
        {"sysv", "SysV shared memory", "/SYSV00000000", SM_SHARED, 16, true},
        {"dev_shm", "POSIX shared memory", "/dev/shm/" + files, SM_SHARED, 16, false},
        {"file_cow", "mapped file", files + "-cow", SM_COW, 4, false},
        {"file_private", "mapped file", files + "-private", SM_COW, 0, false},
        {"anon_written", "anonymous", "", SM_PRIVATE, 64, false},
        {"anon_inherited", "anonymous", "", SM_COW, 16, false},  // its pages are the child's too
    };
    for (const auto& expected : expectations) {
        SCOPED_TRACE(expected.area);
        if (!fixture.area(expected.area)) continue;  // no /dev/shm on this machine
        const RKMemoryRegion& region = regionAt(*parent, fixture, expected.area);
        EXPECT_EQ(region.start, fixture.area(expected.area)->address);
        EXPECT_EQ(region.size, fixture.area(expected.area)->size);
        EXPECT_EQ(region.name, expected.name);
        EXPECT_TRUE(region.detailedName.ends_with(expected.detail)) << region.detailedName;
        EXPECT_EQ(region.detailedName.empty(), expected.detail.empty());
        EXPECT_EQ(region.share_mode, expected.shareMode);
        EXPECT_EQ(region.dirtySize, expected.dirtyPages * P);
        EXPECT_EQ(regionAt(*child, fixture, expected.area).object_id == region.object_id, expected.sharedWithChild);
    }
    EXPECT_EQ(regionAt(*parent, fixture, "file_private").cleanNonSpecSize, 16 * P);
    const auto kernel = [&](const char* field, const char* area) {
        return RKKernelField(fixture.pid(), "smaps", field, fixture.area(area)->address);
    };
    EXPECT_EQ(regionAt(*parent, fixture, "mlocked").wiredSize(), kernel("Locked", "mlocked"));
    EXPECT_EQ(regionAt(*parent, fixture, "mlocked").wiredSize(), 8 * P);
    // MADV_FREE skips a page someone else holds at that moment, so a few may stay dirty.
    const RKMemoryRegion& freed = regionAt(*parent, fixture, "madv_free");
    EXPECT_EQ(freed.dirtySize + freed.reclaimableSize, 64 * P);
    EXPECT_EQ(freed.reclaimableSize, kernel("LazyFree", "madv_free"));
    EXPECT_GE(freed.reclaimableSize, 28 * P);
    const RKMemoryRegion& shared = regionAt(*parent, fixture, "file_shared");
    EXPECT_EQ(shared.dirtySize + shared.cleanNonSpecSize, 8 * P) << "written pages, dirty until written back";
    EXPECT_EQ(regionAt(*parent, fixture, "heap").name, "heap");
    EXPECT_TRUE(std::ranges::any_of(*parent->memoryRegions(), [](const auto& r) { return r->name == "stack"; }));
}

TEST(RKUserProcessFixture, ReportShowsSharedMemoryOnceTheDocumentAgreesAndAllProcessesUnderAll) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    const std::string parent = std::to_string(fixture.pid()), child = std::to_string(fixture.childPid());
    const auto document = std::filesystem::temp_directory_path() / ("rkfixture-" + parent + ".json");
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-j", document.string(), parent, child});
    RKCommandResult parsed = RKRunCommand({"python3", "-c", kSummarizeDocument, document.string()});
    std::filesystem::remove(document);
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    ASSERT_TRUE(parsed.exitedWith(0)) << "the document does not parse: " << parsed.standardError;
    const std::string& report = run.standardOutput;
    // In each process's block the pages it maps; in the summary the object once and whole.
    const struct {
        const char* kind;
        uint64_t inEachBlock, inSummary;
    } sharedKinds[] = {
        {"memfd", 16 * P, 32 * P}, {"shared anonymous", 16 * P, 16 * P}, {"SysV shared memory", 16 * P, 16 * P}};
    auto summary = RKColumnByCategory(report, "Summary Memspread: ");
    // Each process's own, the first block (what both map) once, and the memfd's other half.
    uint64_t once = RKColumnByCategory(report, "Shared with ")["TOTAL"] + 16 * P;
    for (const std::string& header : {"[" + parent + "]: 64-bit", "[" + child + "]: 64-bit"}) {
        SCOPED_TRACE(header);
        auto own = RKColumnByCategory(report, header);
        auto shared = RKColumnByCategory(report, "Shared with ", report.find(header));
        for (const auto& expected : sharedKinds) {
            EXPECT_EQ(shared[expected.kind], expected.inEachBlock) << expected.kind;
            EXPECT_EQ(own.count(expected.kind), 0u) << expected.kind << " is not the process's alone";
            EXPECT_EQ(summary[expected.kind], expected.inSummary) << expected.kind;
        }
        once += own["TOTAL"];
    }
    EXPECT_EQ(summary["TOTAL"], once) << report;
    // Each process costs what the kernel charges it (RssAnon + RssShmem + VmSwap + VmPTE − LazyFree),
    // plus the dirty pages of the file it maps shared, which the kernel leaves to the page cache.
    const uint64_t fileShared = fixture.area("file_shared")->address;
    const uint64_t fileSharedDirty = RKKernelField(fixture.pid(), "smaps", "Shared_Dirty", fileShared) +
                                     RKKernelField(fixture.pid(), "smaps", "Private_Dirty", fileShared);
    EXPECT_EQ(RKReportedMemspread(report, fixture.pid()), RKKernelMemspread(fixture.pid()) + fileSharedDirty);
    EXPECT_EQ(RKReportedMemspread(report, fixture.childPid()), RKKernelMemspread(fixture.childPid()));

    // The document holds each process's header figure, in pid order, and one shared record of the two.
    const pid_t low = std::min(fixture.pid(), fixture.childPid()), high = std::max(fixture.pid(), fixture.childPid());
    std::string expected;
    for (const pid_t pid : {low, high})
        expected += std::to_string(pid) + " " + std::to_string(RKReportedMemspread(report, pid)) + "\n";
    expected += "shared " + std::to_string(low) + " " + std::to_string(high) + "\n";
    EXPECT_TRUE(parsed.standardOutput.starts_with(expected)) << parsed.standardOutput << "expected:\n" << expected;

    if (geteuid() != 0) GTEST_SKIP() << "frames and -a need root";
    // With frames, the anonymous pages the two share since the fork count once in the summary:
    // the kernel's Pss_Anon over both, less what it lazily frees. They are in the categories of
    // anonymous memory, image data, and mapped files (private copies, beside file_shared's pages).
    uint64_t pssAnon = 0;
    for (const pid_t pid : {fixture.pid(), fixture.childPid()})
        pssAnon += RKKernelField(pid, "smaps_rollup", "Pss_Anon") - RKKernelField(pid, "smaps_rollup", "LazyFree");
    const uint64_t anonymous = summary["anonymous"] + summary["heap"] + summary["stack"] + summary[".data"] +
                               summary[".data.rel.ro"] + summary["mapped file"] - fileSharedDirty;
    EXPECT_NEAR(static_cast<double>(anonymous), static_cast<double>(pssAnon), 0.01 * static_cast<double>(pssAnon))
        << report.substr(report.find("Summary Memspread: "));

    // -a reports every process: these among them, and the kernel.
    run = RKRunCommand({MEMSPREAD_BINARY, "-a", "-f", "bytes"});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    for (const std::string& pid : {parent, child, std::to_string(getpid())})
        EXPECT_NE(run.standardOutput.find("[" + pid + "]: 64-bit\tMemspread: "), std::string::npos) << pid;
    EXPECT_NE(run.standardOutput.find("kernel [0]: 64-bit"), std::string::npos);
}

// Without root, the memfd still counts once by the pages each process maps; the anonymous pages
// the two share since the fork cannot be told apart, and one warning bounds them.
TEST(RKUserProcessFixture, WithoutRootTheMemfdCountsOnceAndOneWarningBoundsSharedAnonymousMemory) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the fixture and the binary as nobody";
    RKFixtureProcess fixture;
    const std::vector<std::string> command = RKAsNobody(MEMSPREAD_FIXTURE, {"/tmp"});
    ASSERT_TRUE(fixture.start(command[0], {command.begin() + 1, command.end()})) << fixture.error();
    const std::string parent = std::to_string(fixture.pid()), child = std::to_string(fixture.childPid());
    RKCommandResult run = RKRunCommand(RKAsNobody(MEMSPREAD_BINARY, {"-f", "bytes", parent, child}));
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_EQ(RKColumnByCategory(run.standardOutput, "Summary Memspread: ")["memfd"], 32 * P) << run.standardOutput;
    const uint64_t bound = RKKernelSharedAnonymous(fixture.pid()) + RKKernelSharedAnonymous(fixture.childPid());
    EXPECT_GT(bound, 16 * P);
    EXPECT_NE(run.standardError.find("memspread: " + std::to_string(bound) + " bytes of anonymous memory are shared"),
              std::string::npos)
        << run.standardError;
}

TEST(RKUserProcessFixture, ProcessThatExitsBeforeItsPageQueryIsAWarning) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    auto process = std::make_shared<RKExitsAfterWalk>();
    ASSERT_TRUE(process->initWithBsdInfo(*RKPlatform::current().bsdInfo(fixture.pid())));
    testing::internal::CaptureStderr();
    process->gatherData();
    testing::internal::GetCapturedStderr();
    ASSERT_EQ(process->warnings().size(), 1u);
    EXPECT_TRUE(process->warnings().front().ends_with(" (process exited)")) << process->warnings().front();
    EXPECT_TRUE(process->errors().empty());
    EXPECT_TRUE(process->memoryRegions()) << "the run goes on with the regions of the walk";
}
