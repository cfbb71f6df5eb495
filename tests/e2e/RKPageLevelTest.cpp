// Page-level accounting of live processes: a parent and a child that each wrote half of a
// memfd and of a shared file count each object once and whole, each process's sharing block
// holds its own half, and subranges of zero-page, lazily freed and locked memory agree with the
// kernel's own counts.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <fstream>
#include <regex>

#include "RKKernelFigures.h"
#include "model/RKMemoryRegion.h"
#include "model/RKRangeList.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"
#include "support/RKUnprivileged.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
const uint64_t MiB = 1 << 20;

// Anonymous pages of the private mappings of `pid` that other mappings hold too, in bytes, as
// smaps tells them: Shared_Clean + Shared_Dirty of anonymous memory; of a private file (or
// memfd) mapping, its shared copies: Shared_Dirty, no more than its Anonymous.
uint64_t sharedAnonymousBytes(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/smaps");
    static const std::regex header(R"(^[0-9a-f]+-[0-9a-f]+ \S{3}(.) \S+ \S+ (\d+) *(.*)$)");
    std::string line;
    bool priv = false, anonymous = false;
    uint64_t bytes = 0, sharedClean = 0, sharedDirty = 0, copies = 0;
    auto add = [&] {
        if (priv) bytes += anonymous ? sharedClean + sharedDirty : std::min(sharedDirty, copies);
        sharedClean = sharedDirty = copies = 0;
    };
    auto kB = [&](size_t prefix) { return std::stoull(line.substr(prefix)) * 1024; };
    while (std::getline(in, line)) {
        std::smatch match;
        if (std::regex_match(line, match, header)) {
            add();
            const std::string path = match[3];
            anonymous = match[2] == "0" &&
                        (path.empty() || path == "[heap]" || path.starts_with("[stack") || path.starts_with("[anon:"));
            // Special mappings ([vdso], [vvar]) have inode 0 and hold no anonymous pages.
            priv = match[1] == "p" && (anonymous || match[2] != "0");
        } else if (line.starts_with("Shared_Clean:")) {
            sharedClean = kB(13);
        } else if (line.starts_with("Shared_Dirty:")) {
            sharedDirty = kB(13);
        } else if (line.starts_with("Anonymous:")) {
            copies = kB(10);
        }
    }
    add();
    return bytes;
}

const RKMemoryRegion* regionAt(const RKProcess& process, uint64_t address) {
    for (const auto& region : process.memoryRegions().value_or(RKRegionList{}))
        if (region->start == address) return region.get();
    return nullptr;
}

// The process measured in-process, as the program measures it (breakdown on).
std::shared_ptr<RKProcess> gathered(pid_t pid) {
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    auto process = RKProcess::processWithPid(pid);
    if (process) process->gatherData();
    return process;
}

TEST(RKPageLevel, HalvesWrittenByParentAndChildCountOnceEach) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_HALVES_FIXTURE)) << fixture.error();
    const std::string parent = std::to_string(fixture.pid()), child = std::to_string(fixture.childPid());
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", parent, child});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string& report = run.standardOutput;
    // memfd_halves whole (16 MiB) and the touched half of memfd_half.
    EXPECT_EQ(RKDirtyByCategory(report, "Summary Memspread: ")["memfd"], 16 * MiB + 8 * MiB) << report;
    EXPECT_EQ(RKDirtyByCategory(report, "Shared with ", report.find("[" + parent + "]: 64-bit"))["memfd"], 16 * MiB);
    EXPECT_EQ(RKDirtyByCategory(report, "Shared with ", report.find("[" + child + "]: 64-bit"))["memfd"], 8 * MiB);
    if (geteuid() != 0) return;
    // file_halves whole, beside a few pages of the program's own libraries.
    uint64_t files = RKDirtyByCategory(report, "Summary Memspread: ")["mapped file"];
    EXPECT_GE(files, 16 * MiB + 8 * P);
    EXPECT_LT(files, 18 * MiB) << report;
    EXPECT_GE(RKDirtyByCategory(report, "Shared with ", report.find("[" + child + "]: 64-bit"))["mapped file"], 8 * MiB);
}

TEST(RKPageLevel, PageStatesAgreeWithTheKernelsCounts) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_HALVES_FIXTURE)) << fixture.error();
    auto parent = gathered(fixture.pid());
    ASSERT_TRUE(parent);

    // Pages only read map the zero page, which is never memory: the 8 written pages alone,
    // from page data (subranges) without root, from the region and its shared pages with it.
    const RKMemoryRegion* zeroRead = regionAt(*parent, fixture.area("anon_zero_read")->address);
    ASSERT_TRUE(zeroRead);
    const uint64_t zeroReadDirty = zeroRead->subrangeList() ? zeroRead->subrangeList()->sum().dirty : zeroRead->dirtySize;
    EXPECT_EQ(zeroReadDirty, 8 * P);

    const uint64_t lockedAddress = fixture.area("locked_file")->address;
    const RKMemoryRegion* locked = regionAt(*parent, lockedAddress);
    ASSERT_TRUE(locked);
    EXPECT_EQ(locked->wiredSize(), RKKernelField(fixture.pid(), "smaps", "Locked", lockedAddress));
    if (locked->subrangeList()) {
        EXPECT_EQ(locked->subrangeList()->sum().wired, 16 * P) << "every run is wired";
    }

    // In the report, what is reclaimable is what the kernel calls lazily freed, to the page.
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", std::to_string(fixture.pid())});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    static const std::regex row(R"(^ *\d+ B +\d+ B +(\d+) B +\d+    TOTAL$)");
    std::smatch match;
    uint64_t reclaimable = 0;
    for (const std::string& line : RKSplitLines(run.standardOutput))
        if (std::regex_match(line, match, row)) reclaimable += std::stoull(match[1]);
    EXPECT_EQ(reclaimable, RKKernelField(fixture.pid(), "smaps_rollup", "LazyFree"));
    EXPECT_GT(reclaimable, 0u) << run.standardOutput;
}

TEST(RKPageLevel, MemfdHalvesWithoutRoot) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the fixture and the binary as nobody";
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_HALVES_FIXTURE, {"--as-nobody"})) << fixture.error();
    RKCommandResult run = RKRunCommand(RKCommandAsNobody({"-f", "bytes", std::to_string(fixture.pid()),
                                                          std::to_string(fixture.childPid())}));
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_EQ(RKDirtyByCategory(run.standardOutput, "Summary Memspread: ")["memfd"], 16 * MiB + 8 * MiB) << run.standardOutput;
    // Anonymous pages inherited across the fork (copies in private file mappings too) cannot be
    // attributed without frames: one warning bounds what the summary may count twice.
    const uint64_t bound = sharedAnonymousBytes(fixture.pid()) + sharedAnonymousBytes(fixture.childPid());
    EXPECT_GT(bound, 0u);
    EXPECT_NE(run.standardError.find("memspread: " + std::to_string(bound) + " bytes of anonymous memory are shared"),
              std::string::npos)
        << run.standardError;
}

// The process is killed and reaped after its walk, before its page data is read.
class RKExitsAfterWalk : public RKUserProcess {
public:
    void enumerateRegions(const RKRegionCallback& callback) override {
        RKUserProcess::enumerateRegions(callback);
        ::kill(pid(), SIGKILL);
        ::waitpid(pid(), nullptr, 0);
    }
};

TEST(RKPageLevel, ProcessThatExitsBeforeItsPageQueryIsAWarning) {
    int input[2], output[2];
    ASSERT_EQ(pipe(input), 0);
    ASSERT_EQ(pipe(output), 0);
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        dup2(input[0], STDIN_FILENO);
        dup2(output[1], STDOUT_FILENO);
        execl(MEMSPREAD_HALVES_FIXTURE, MEMSPREAD_HALVES_FIXTURE, "/tmp", static_cast<char*>(nullptr));
        _exit(127);
    }
    close(input[0]);
    close(output[1]);
    // Ready once it says so: every area written (its standard input stays open till then).
    std::string said;
    char buffer[512];
    for (ssize_t n; said.find("ready\n") == std::string::npos && (n = read(output[0], buffer, sizeof buffer)) > 0;)
        said.append(buffer, static_cast<size_t>(n));
    close(output[0]);
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    auto process = std::make_shared<RKExitsAfterWalk>();
    ASSERT_TRUE(process->initWithBsdInfo(*RKPlatform::current().bsdInfo(child)));
    testing::internal::CaptureStderr();
    process->gatherData();
    testing::internal::GetCapturedStderr();
    ASSERT_EQ(process->warnings().size(), 1u);
    EXPECT_TRUE(process->warnings().front().ends_with(" (process exited)")) << process->warnings().front();
    EXPECT_TRUE(process->errors().empty());
    EXPECT_TRUE(process->memoryRegions()) << "the run goes on with the regions of the walk";
    close(input[1]);
}

}  // namespace
