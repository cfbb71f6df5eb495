// Memory a live process holds without mapping it, measured end to end on the owned-memory
// fixture: a 64 MiB memfd it only holds (and a child maps), a 16 MiB /dev/shm file it keeps
// open, an 8 MiB SysV segment it detached, an 8 MiB memfd it maps privately. Compared with the
// kernel's own per-process figures, which count none of the held memory.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <numeric>
#include <regex>
#include <tuple>

#include "RKKernelFigures.h"
#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
constexpr uint64_t MiB = 1024 * 1024;

// The Dirty of the memfd row in the block of what `pid` shares with the mapper `sharer`.
uint64_t sharedMemfd(const std::string& report, pid_t pid, pid_t sharer) {
    return RKDirtyByCategory(report, "Shared with memspread_owned_fixture [" + std::to_string(sharer) + "]:",
                             report.find("[" + std::to_string(pid) + "]: 64-bit"))["memfd"];
}

}  // namespace

TEST(RKOwnedMemoryFixture, HeldMemoryIsOwnedChargedOnceToItsHolderAndFoundByUnmapped) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_OWNED_FIXTURE)) << fixture.error();
    const pid_t holder = fixture.pid(), mapper = fixture.childPid();
    // Held and unmapped: the memfd, the /dev/shm file (when this machine has /dev/shm), the segment.
    std::vector<uint64_t> heldSizes{8 * MiB, 64 * MiB};
    if (fixture.area("dev_shm")) heldSizes.insert(heldSizes.begin() + 1, 16 * MiB);
    const uint64_t held = std::reduce(heldSizes.begin(), heldSizes.end());

    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    auto process = RKProcess::processWithPid(holder);
    ASSERT_TRUE(process);
    process->gatherData();
    uint64_t memspread = 0, unmapped = 0;
    std::vector<uint64_t> unmappedSizes;
    for (const auto& region : *process->memoryRegions()) {
        memspread += region->dirtySize + region->swappedSize;
        if (region->start == fixture.area("private_memfd")->address) {
            EXPECT_EQ(std::tuple(region->name, region->dirtySize, region->cleanNonSpecSize),
                      std::tuple("memfd", 8 * MiB, 0u))
                << "shmem pages, not clean page cache";
        }
        if (!region->isFake()) continue;
        EXPECT_TRUE(region->ownedExclusivelyByParentProcess);
        unmapped += region->dirtySize + region->swappedSize;
        unmappedSizes.push_back(region->size);
    }
    std::sort(unmappedSizes.begin(), unmappedSizes.end());
    EXPECT_EQ(unmappedSizes, heldSizes);
    EXPECT_NEAR(static_cast<double>(unmapped), static_cast<double>(held), 3.0 * P);
    // Everything the kernel counts for its mappings, plus what it holds: a page per object.
    EXPECT_NEAR(static_cast<double>(memspread), static_cast<double>(RKKernelMemspread(holder) + held), 4.0 * P);

    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", std::to_string(holder), std::to_string(mapper)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string& report = run.standardOutput;
    EXPECT_EQ(sharedMemfd(report, holder, mapper), 64 * MiB) << report;
    std::smatch summary;
    ASSERT_TRUE(std::regex_search(report, summary, std::regex(R"(Summary Memspread: (\d+) B)")));
    // The memfd counts once, for its holder; what the pair shares since the fork each process's
    // figure counts whole, the summary once.
    const uint64_t sharedAfterFork = (RKKernelSharedAnonymous(holder) + RKKernelSharedAnonymous(mapper)) / 2;
    EXPECT_GT(sharedAfterFork, 0u);
    EXPECT_EQ(std::stoull(summary[1]),
              RKReportedMemspread(report, holder) + RKReportedMemspread(report, mapper) - sharedAfterFork)
        << report;
    EXPECT_LT(RKReportedMemspread(report, mapper), 64 * MiB);
    const uint64_t holderMemspread = RKReportedMemspread(report, holder);
    EXPECT_GE(holderMemspread, held + 8 * MiB);

    // The mapper is not a target: --unmapped finds it, hidden, as the memfd's other process.
    if (geteuid() != 0) GTEST_SKIP() << "--unmapped needs root";
    run = RKRunCommand({MEMSPREAD_BINARY, "--unmapped", "-f", "bytes", std::to_string(holder)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_EQ(sharedMemfd(run.standardOutput, holder, mapper), 64 * MiB) << run.standardOutput;
    EXPECT_EQ(RKReportedMemspread(run.standardOutput, mapper), 0u) << "hidden";
    EXPECT_NEAR(static_cast<double>(RKReportedMemspread(run.standardOutput, holder)),
                static_cast<double>(holderMemspread), 4.0 * P);
}
