// Timestamps on Linux: the three clocks read together, the wall clock from 2001. (Linux's
// timebase is 1/1; dates and durations made of fixed readings are the output tests' golden files.)
#include <gtest/gtest.h>

#include <ctime>

#include "model/RKTime.h"
#include "platform/RKLinuxPlatform.h"

TEST(RKTime, LinuxClocksAreUptimeBootTimeAndWallTime) {
    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>());
    auto time = RKTime::now();
    ASSERT_TRUE(time);
    EXPECT_GE(time->machContinuousTime(), time->machAbsoluteTime());  // boot time includes sleep
    EXPECT_NEAR(time->wallTime(), static_cast<double>(std::time(nullptr) - RKWallTimeEpochOffset), 2.0);
}
