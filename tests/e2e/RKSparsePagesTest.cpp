// A process that reserved a terabyte (private, copy-on-write shared with its forked child, and
// shared anonymous) and wrote a few pages of it: the pages written are what counts, once. What
// reading it costs is measured by bench/sparse-pages.sh.
#include <gtest/gtest.h>
#include <unistd.h>

#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"

namespace {

TEST(RKSparsePages, ATerabyteReservedCountsItsWrittenPagesOnce) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_SPARSE_FIXTURE)) << fixture.error();
    ASSERT_TRUE(fixture.area("reserved") && fixture.area("shared"));
    RKCommandResult run = RKRunCommand(
        {MEMSPREAD_BINARY, "-f", "bytes", std::to_string(fixture.pid()), std::to_string(fixture.childPid())});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    // Five pages written in the shared terabyte, which both processes map.
    const uint64_t page = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
    EXPECT_EQ(RKDirtyByCategory(run.standardOutput, "Summary Memspread: ")["shared anonymous"], 5 * page)
        << run.standardOutput;
}

}  // namespace
