#include "platform/RKProcStatParser.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "platform/RKKernelTypes.h"

namespace {

std::string captured(const char* name) {
    std::ifstream in(std::string(MEMSPREAD_TEST_DATA) + "/proc-stat/" + name);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

}  // namespace

TEST(RKProcStatParser, CapturedFilesAndTruncatedText) {
    // A process named "x) (y z": a parser that stops at the first ')' reads "(y" as the state.
    std::string text = captured("paren-name.stat");
    auto stat = RKParseProcStat(text);
    ASSERT_TRUE(stat);
    EXPECT_EQ(stat->pid, 7839);
    EXPECT_EQ(stat->comm, "x) (y z");
    EXPECT_EQ(stat->state, 'S');
    EXPECT_EQ(stat->ppid, 7838);
    EXPECT_EQ(stat->flags & RK_PF_KTHREAD, 0u);

    auto kthread = RKParseProcStat(captured("kthread.stat"));
    ASSERT_TRUE(kthread);
    EXPECT_EQ(kthread->ppid, 0);
    EXPECT_NE(kthread->flags & RK_PF_KTHREAD, 0u);
    EXPECT_EQ(RKBsdStatusForProcState(RKParseProcStat(captured("zombie.stat"))->state), SZOMB);

    // A process that exits mid-read leaves an empty or cut-off file.
    EXPECT_FALSE(RKParseProcStat(""));
    EXPECT_FALSE(RKParseProcStat("12 (name) S"));
    EXPECT_FALSE(RKParseProcStat(text.substr(0, text.find(" 4194304"))));  // cut before the flags
}
