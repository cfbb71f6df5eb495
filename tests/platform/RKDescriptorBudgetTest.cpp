// The descriptor budget that lets any descriptor limit measure every process, and the records a
// task reads through its own directory descriptor.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "platform/RKDescriptorBudget.h"
#include "platform/RKLinuxPlatform.h"
#include "platform/RKProcStatParser.h"

using namespace std::chrono_literals;

TEST(RKDescriptorBudget, SizedFromTheLimitWaitsForASlotAndShrinksOnFailure) {
    EXPECT_EQ(RKDescriptorBudget::capacityForLimit(8), 1u) << "even a tiny limit reads one process at a time";
    EXPECT_EQ(RKDescriptorBudget::capacityForLimit(1ull << 40), 4096u);

    RKDescriptorBudget budget(2, 20s);
    RKDescriptorTicket first = budget.acquire();
    RKDescriptorTicket second = budget.acquire();
    std::atomic<bool> acquired{false};
    std::thread waiter([&] {
        RKDescriptorTicket third = budget.acquire();
        acquired = true;
    });
    std::this_thread::sleep_for(50ms);
    EXPECT_FALSE(acquired) << "waits while the budget is spent";
    first.release();
    waiter.join();
    EXPECT_EQ(budget.inUse(), 1u);

    // An open failed for want of descriptors while another slot was held: the slot goes back and
    // the budget shrinks to what is held; alone, the failure is final.
    RKDescriptorTicket again = budget.acquire();
    EXPECT_TRUE(budget.shrinkAfterFailure(again));
    EXPECT_EQ(budget.capacity(), 1u);
    EXPECT_EQ(budget.inUse(), 1u);
    EXPECT_FALSE(budget.shrinkAfterFailure(second));
    second.release();
    EXPECT_EQ(budget.inUse(), 0u);

    RKDescriptorBudget impatient(1, 10ms);
    RKDescriptorTicket held = impatient.acquire();
    bool timedOut = false;
    RKDescriptorTicket nested = impatient.acquire(&timedOut);  // a holder asking again is not stuck forever
    EXPECT_TRUE(timedOut);
    EXPECT_EQ(impatient.inUse(), 2u);
}

TEST(RKLinuxTask, ReadsTheProcessItWasOpenedOn) {
    std::string line = "41 (a) b) R 1 41 41 0 -1 4194560 97 0 0 0 1 2 0 0 20 0 1 0 123456 4096 100";
    EXPECT_EQ(RKParseProcStat(line)->startTime, 123456u);
    EXPECT_EQ(RKParseProcStat("41 (a) R 1 41 41 0 -1 4194560")->startTime, 0u) << "absent: 0";

    RKLinuxPlatform platform;
    std::unique_ptr<RKTask> task;
    ASSERT_EQ(platform.taskForPid(getpid(), task), KERN_SUCCESS);
    auto listed = platform.bsdInfo(getpid());
    auto opened = platform.taskBsdInfo(*task);
    ASSERT_TRUE(listed && opened);
    EXPECT_GT(opened->pbi_start_tvsec + opened->pbi_start_tvusec, 0u);
    EXPECT_EQ(std::pair(opened->pbi_start_tvsec, opened->pbi_start_tvusec),
              std::pair(listed->pbi_start_tvsec, listed->pbi_start_tvusec));
    EXPECT_EQ(platform.taskExecutablePath(*task), platform.executablePath(getpid()));
    uint32_t status = 0;
    EXPECT_EQ(platform.taskShortBsdInfoStatus(*task, status), 0);
    std::unique_ptr<RKTask> none;
    EXPECT_EQ(platform.taskForPid(0x3FFFFFFF, none), KERN_INVALID_ARGUMENT) << "no such process: gone";
}
