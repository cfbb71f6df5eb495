// Timestamps: the tick conversion through the platform's timebase, the 2001 wall-clock epoch,
// and the three clocks read together.
#include <gtest/gtest.h>

#include <ctime>
#include <thread>

#include "model/RKTime.h"
#include "platform/RKLinuxPlatform.h"
#include "platform/RKScriptedPlatform.h"

TEST(RKTime, ScriptedClocksThroughATimebaseReadOnceAndTheWallClockFrom2001) {
    auto platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope(platform);
    RKTime::resetTimebase();
    platform->base = {125, 3};
    platform->clocks = RKClockReadings{24000000, 48000000, 1700000000, 123000000};
    // Threads converting first at the same time read the timebase once between them.
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; i++) threads.emplace_back([] { EXPECT_EQ(RKTime::toNanoseconds(3), 125u); });
    for (auto& thread : threads) thread.join();
    auto time = RKTime::now();
    ASSERT_TRUE(time);
    EXPECT_EQ(time->machAbsoluteTimeNsec(), 1000000000u);
    EXPECT_EQ(time->machContinuousTimeNsec(), 2000000000u);
    EXPECT_EQ(platform->callCount("timebase"), 1u);
    // Seconds since 2001; the date keeps the sub-second part however far from 2001 it is.
    EXPECT_DOUBLE_EQ(time->wallTime(), 721692800.123);  // 1700000000 - 978307200 seconds
    EXPECT_EQ(std::chrono::duration_cast<std::chrono::milliseconds>(time->date().time_since_epoch()).count(),
              1700000000123);
    // Multiplied before divided: 5 × 3 / 2 = 7, where dividing first would give 6.
    EXPECT_EQ(RKTime::convert(5, {3, 2}), 7u);
    platform->clocksFail = true;
    EXPECT_FALSE(RKTime::now());
    RKTime::resetTimebase();
}

TEST(RKTime, LinuxClocksAreUptimeBootTimeAndWallTime) {
    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>());
    auto time = RKTime::now();
    ASSERT_TRUE(time);
    EXPECT_GE(time->machContinuousTime(), time->machAbsoluteTime());  // boot time includes sleep
    EXPECT_NEAR(time->wallTime(), static_cast<double>(std::time(nullptr) - RKWallTimeEpochOffset), 2.0);
}
