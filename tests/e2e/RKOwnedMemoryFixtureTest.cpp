// Memory a live process holds without mapping it, measured end to end on the owned-memory
// fixture: a 64 MiB memfd it only holds (and a child maps), a 16 MiB /dev/shm file it keeps
// open, an 8 MiB SysV segment it detached. Compared with the kernel's own per-process figures,
// which count none of the held memory.
#include <gtest/gtest.h>
#include <unistd.h>

#include <regex>

#include "RKKernelFigures.h"
#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
constexpr uint64_t MiB = 1024 * 1024;

// The Dirty of the memfd row in the block of what `pid` shares with the mapper `sharer`.
uint64_t sharedMemfd(const std::string& report, pid_t pid, pid_t sharer) {
    return RKColumnByCategory(report, "Shared with memspread_owned_fixture [" + std::to_string(sharer) + "]:",
                             report.find("[" + std::to_string(pid) + "]: 64-bit"))["memfd"];
}

}  // namespace

TEST(RKOwnedMemoryFixture, HeldMemoryIsChargedOnceToItsHolderAndUnmappedFindsItsMapper) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_OWNED_FIXTURE)) << fixture.error();
    const pid_t holder = fixture.pid(), mapper = fixture.childPid();
    RKCommandResult run =
        RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", std::to_string(holder), std::to_string(mapper)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string& report = run.standardOutput;
    // The holder costs what the kernel counts for its mappings plus what it holds unmapped (the
    // memfd, the /dev/shm file when this machine has /dev/shm, the segment): a page per object.
    const uint64_t held = 64 * MiB + (fixture.area("dev_shm") ? 16 * MiB : 0) + 8 * MiB;
    const uint64_t holderMemspread = RKReportedMemspread(report, holder);
    EXPECT_NEAR(static_cast<double>(holderMemspread), static_cast<double>(RKKernelMemspread(holder) + held), 4.0 * P);
    EXPECT_EQ(sharedMemfd(report, holder, mapper), 64 * MiB) << report;
    EXPECT_LT(RKReportedMemspread(report, mapper), 64 * MiB);
    // The memfd counts once, for its holder; what the pair shares since the fork each process's
    // figure counts whole, the summary once.
    std::smatch summary;
    ASSERT_TRUE(std::regex_search(report, summary, std::regex(R"(Summary Memspread: (\d+) B)")));
    const uint64_t sharedAfterFork = (RKKernelSharedAnonymous(holder) + RKKernelSharedAnonymous(mapper)) / 2;
    EXPECT_GT(sharedAfterFork, 0u);
    EXPECT_EQ(std::stoull(summary[1]), holderMemspread + RKReportedMemspread(report, mapper) - sharedAfterFork)
        << report;

    // The mapper is not a target: --unmapped finds it, hidden, as the memfd's other process.
    if (geteuid() != 0) GTEST_SKIP() << "--unmapped needs root";
    run = RKRunCommand({MEMSPREAD_BINARY, "--unmapped", "-f", "bytes", std::to_string(holder)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_EQ(sharedMemfd(run.standardOutput, holder, mapper), 64 * MiB) << run.standardOutput;
    EXPECT_EQ(RKReportedMemspread(run.standardOutput, mapper), 0u) << "hidden";
    EXPECT_NEAR(static_cast<double>(RKReportedMemspread(run.standardOutput, holder)),
                static_cast<double>(holderMemspread), 4.0 * P);
}
