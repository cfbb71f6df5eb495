// The descriptor budget that lets any descriptor limit measure every process.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "platform/RKDescriptorBudget.h"

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
