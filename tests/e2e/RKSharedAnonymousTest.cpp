// Anonymous memory inherited across fork, end to end: a parent that wrote a few hundred mappings
// and a heap forks workers that each copy a page or two. The summary counts the tree's anonymous
// memory once (the kernel's own figure is the sum of Pss_Anon over the tree), every process is
// still charged what the kernel charges it, and the pages all of them share are in the block
// they all share.
#include <gtest/gtest.h>
#include <unistd.h>

#include <regex>

#include "RKKernelFigures.h"
#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// The pids of the processes a report has a header for.
std::vector<pid_t> reportedPids(const std::string& report) {
    std::vector<pid_t> pids;
    static const std::regex header(R"(\[(\d+)\]: 64-bit\tMemspread:)");
    for (std::sregex_iterator it(report.begin(), report.end(), header), end; it != end; ++it)
        pids.push_back(std::stoi((*it)[1]));
    return pids;
}

TEST(RKSharedAnonymous, ForkedWorkersShareTheirParentsMemoryOnce) {
    if (geteuid() != 0) GTEST_SKIP() << "frames are visible to root only";
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FORKTREE_FIXTURE, {"20"})) << fixture.error();
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-t", std::to_string(fixture.pid())});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string& report = run.standardOutput;
    const std::vector<pid_t> tree = reportedPids(report);
    ASSERT_EQ(tree.size(), 21u) << report;

    // The tree's unique anonymous memory, and each process's own figure, from the kernel.
    uint64_t pssAnon = 0;
    for (pid_t pid : tree) {
        SCOPED_TRACE(pid);
        pssAnon += RKKernelField(pid, "smaps_rollup", "Pss_Anon");
        EXPECT_EQ(RKReportedMemspread(report, pid), RKKernelMemspread(pid));
    }
    auto summary = RKDirtyByCategory(report, "Summary Memspread: ");
    // Anonymous pages in the kernel's sense live in these categories: a private file mapping's
    // copies are under its image segment (relocated ".data", ".data.rel.ro") or its file.
    const uint64_t anonymous = summary["anonymous"] + summary["heap"] + summary["stack"] + summary[".data"] +
                               summary[".data.rel.ro"] + summary["mapped file"];
    EXPECT_NEAR(static_cast<double>(anonymous), static_cast<double>(pssAnon), 0.01 * static_cast<double>(pssAnon))
        << report.substr(report.find("Summary Memspread: "));

    // The parent's mappings, less the pages the workers copied, are in the block all 21 share.
    const size_t parentSection = report.find("[" + std::to_string(fixture.pid()) + "]: 64-bit");
    const size_t all = report.find("Shared with 21 processes:", parentSection);
    ASSERT_NE(all, std::string::npos) << report;
    EXPECT_GE(RKDirtyByCategory(report, "", all)["anonymous"], fixture.area("mappings")->size - 20 * P);
    EXPECT_GE(RKDirtyByCategory(report, "", all)["heap"], fixture.area("heap")->size - 20 * P);
    // A page a worker copied is its own.
    auto own = RKDirtyByCategory(report, "[" + std::to_string(fixture.childPid()) + "]: 64-bit");
    EXPECT_GE(own["anonymous"], P);
    EXPECT_GE(own["heap"], P);
}

}  // namespace
