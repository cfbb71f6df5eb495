// Memory a live process holds without mapping it, measured end to end on the owned-memory
// fixture: a 64 MiB memfd it only holds (and a child maps), a 16 MiB /dev/shm file it keeps
// open, an 8 MiB SysV segment it detached, an 8 MiB memfd it maps privately. Compared with the
// kernel's own per-process figures, which count none of the held memory.
#include <gtest/gtest.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <regex>
#include <tuple>

#include "RKKernelFigures.h"
#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
constexpr uint64_t MiB = 1024 * 1024;

// Anonymous pages (copies in private file mappings too) that `pid` maps together with another
// process, over two: Anonymous - Pss_Anon of smaps_rollup. Over a pair that shares them after
// fork, the sum is the pages both figures count.
uint64_t halfOfSharedAnonymous(pid_t pid) {
    const uint64_t anonymous = RKKernelField(pid, "smaps_rollup", "Anonymous");
    return anonymous - std::min(anonymous, RKKernelField(pid, "smaps_rollup", "Pss_Anon"));
}

// The Dirty of the memfd row in the first "Shared with <sharer>" block after `pid`'s header.
uint64_t sharedMemfdDirty(const std::string& report, pid_t pid, pid_t sharer) {
    size_t at = report.find("[" + std::to_string(pid) + "]: 64-bit");
    at = report.find("Shared with memspread_owned_fixture [" + std::to_string(sharer) + "]:", at);
    if (at == std::string::npos) return 0;
    std::smatch match;
    std::string rest = report.substr(at);
    return std::regex_search(rest, match, std::regex(R"(\n *(\d+) B +\d+ B +\d+ B +\d+    memfd\n)"))
               ? std::stoull(match[1])
               : 0;
}

class RKOwnedMemoryFixtureTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(fixture.start(MEMSPREAD_OWNED_FIXTURE)) << fixture.error(); }
    // Held and unmapped: the memfd, the /dev/shm file (when this machine has /dev/shm), the segment.
    uint64_t heldUnmapped() const { return 64 * MiB + (fixture.area("dev_shm") ? 16 * MiB : 0) + 8 * MiB; }
    RKFixtureProcess fixture;
};

}  // namespace

TEST_F(RKOwnedMemoryFixtureTest, HeldMemoryIsOwnedAndPrivateShmemIsDirty) {
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    auto process = RKProcess::processWithPid(fixture.pid());
    ASSERT_TRUE(process);
    process->gatherData();
    const uint64_t kernel = RKKernelMemspread(fixture.pid());

    uint64_t memspread = 0, unmapped = 0;
    std::vector<uint64_t> unmappedSizes;
    for (const auto& region : *process->memoryRegions()) {
        memspread += region->dirtySize + region->swappedSize;
        if (!region->isFake()) continue;
        EXPECT_TRUE(region->ownedExclusivelyByParentProcess);
        unmapped += region->dirtySize + region->swappedSize;
        unmappedSizes.push_back(region->size);
    }
    std::sort(unmappedSizes.begin(), unmappedSizes.end());
    std::vector<uint64_t> expected{8 * MiB, 64 * MiB};
    if (fixture.area("dev_shm")) expected.insert(expected.begin() + 1, 16 * MiB);
    EXPECT_EQ(unmappedSizes, expected);
    EXPECT_NEAR(static_cast<double>(unmapped), static_cast<double>(heldUnmapped()), 3.0 * P);
    // Everything the kernel counts for its mappings, plus what it holds: a page per object.
    EXPECT_NEAR(static_cast<double>(memspread), static_cast<double>(kernel + heldUnmapped()), 4.0 * P);

    for (const auto& region : *process->memoryRegions()) {
        if (region->start != fixture.area("private_memfd")->address) continue;
        EXPECT_EQ(std::tuple(region->name, region->dirtySize, region->cleanNonSpecSize), std::tuple("memfd", 8 * MiB, 0u))
            << "shmem pages, not clean page cache";
    }
}

TEST_F(RKOwnedMemoryFixtureTest, MapperSharesTheHeldMemfdAndUnmappedFindsIt) {
    const pid_t holder = fixture.pid(), mapper = fixture.childPid();
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", std::to_string(holder), std::to_string(mapper)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string& report = run.standardOutput;
    EXPECT_EQ(sharedMemfdDirty(report, holder, mapper), 64 * MiB) << report;
    std::smatch summary;
    ASSERT_TRUE(std::regex_search(report, summary, std::regex(R"(Summary Memspread: (\d+) B)")));
    // The memfd counts once, for its holder; what the pair shares since the fork each process's
    // figure counts whole, the summary once.
    const uint64_t sharedAfterFork = halfOfSharedAnonymous(holder) + halfOfSharedAnonymous(mapper);
    EXPECT_GT(sharedAfterFork, 0u);
    EXPECT_EQ(std::stoull(summary[1]),
              RKReportedMemspread(report, holder) + RKReportedMemspread(report, mapper) - sharedAfterFork)
        << report;
    EXPECT_LT(RKReportedMemspread(report, mapper), 64 * MiB);
    const uint64_t holderMemspread = RKReportedMemspread(report, holder);
    EXPECT_GE(holderMemspread, heldUnmapped() + 8 * MiB);

    // The mapper is not a target: --unmapped finds it, hidden, as the memfd's other process.
    if (geteuid() != 0) GTEST_SKIP() << "--unmapped needs root";
    run = RKRunCommand({MEMSPREAD_BINARY, "--unmapped", "-f", "bytes", std::to_string(holder)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_EQ(sharedMemfdDirty(run.standardOutput, holder, mapper), 64 * MiB) << run.standardOutput;
    EXPECT_EQ(RKReportedMemspread(run.standardOutput, mapper), 0u) << "hidden";
    EXPECT_NEAR(static_cast<double>(RKReportedMemspread(run.standardOutput, holder)),
                static_cast<double>(holderMemspread), 4.0 * P);
}

// A segment whose creator is gone and that nobody maps is held by no process: the report says so.
TEST_F(RKOwnedMemoryFixtureTest, SegmentOfAGoneCreatorIsAWarningOfTheReport) {
    const key_t key = 0x52000000 | getpid();
    const pid_t creator = fork();
    if (creator == 0) {
        void* p = shmat(shmget(key, MiB, IPC_CREAT | IPC_EXCL | 0600), nullptr, 0);
        if (p == reinterpret_cast<void*>(-1)) _exit(1);
        std::memset(p, 1, MiB);
        _exit(shmdt(p) == 0 ? 0 : 1);
    }
    int status = 0;
    waitpid(creator, &status, 0);
    const int shmid = shmget(key, 0, 0);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0 && shmid >= 0);

    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", std::to_string(fixture.pid())});
    shmctl(shmid, IPC_RMID, nullptr);
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string warning = "SysV shared memory segment " + std::to_string(shmid) + " holds " +
                                std::to_string(MiB) + " bytes that no process maps: its creator [" +
                                std::to_string(creator) + "] is gone";
    EXPECT_NE(run.standardOutput.find("Warnings were encountered:\n\t" + warning + "\n"), std::string::npos)
        << run.standardOutput;
    EXPECT_EQ(run.standardOutput.find("SysV shared memory segment " + std::to_string(fixture.area("sysv")->address)),
              std::string::npos)
        << "the fixture's own segment is held by its creator";
}
