// The helper that the end-to-end tests run the binary through: if it loses output, deadlocks on
// a full pipe or hangs on a stuck child, every end-to-end result is wrong.
#include <gtest/gtest.h>
#include <signal.h>

#include "support/RKRunCommand.h"

TEST(RKRunCommand, CapturesLargeOutputOnBothStreamsAndTheStatus) {
    // 256 KiB on each stream, standard error first: far more than a pipe holds, so a helper that
    // reads the streams one after the other never returns.
    RKCommandResult result =
        RKRunCommand({"sh", "-c", "head -c 262144 /dev/zero >&2; head -c 262144 /dev/zero | tr '\\0' o; exit 3"});
    ASSERT_TRUE(result.started);
    EXPECT_TRUE(result.exitedWith(3));
    EXPECT_EQ(result.standardOutput, std::string(256 * 1024, 'o'));
    EXPECT_EQ(result.standardError, std::string(256 * 1024, '\0'));
    EXPECT_EQ(RKSplitLines("a\n\nb").size(), 3u);
}

TEST(RKRunCommand, SignalsTimeoutsAndMissingPrograms) {
    RKCommandOptions interrupt;
    interrupt.signalAfter = std::chrono::milliseconds(100);
    interrupt.signal = SIGINT;
    RKCommandResult interrupted = RKRunCommand({"sleep", "30"}, interrupt);
    EXPECT_EQ(interrupted.terminatingSignal, SIGINT);
    EXPECT_FALSE(interrupted.timedOut);

    RKCommandOptions impatient;
    impatient.timeout = std::chrono::milliseconds(200);
    RKCommandResult stuck = RKRunCommand({"sleep", "30"}, impatient);
    EXPECT_TRUE(stuck.timedOut);
    EXPECT_EQ(stuck.terminatingSignal, SIGKILL);

    EXPECT_FALSE(RKRunCommand({"/nonexistent/memspread-test-program"}).started);
}
