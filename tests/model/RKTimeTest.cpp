// Timestamps: the tick conversion through the platform's timebase, the 2001 wall-clock epoch,
// and the three clocks read together.
#include <gtest/gtest.h>

#include <ctime>
#include <memory>
#include <thread>
#include <vector>

#include "model/RKTime.h"
#include "platform/RKLinuxPlatform.h"
#include "platform/RKScriptedPlatform.h"

namespace {

// A scripted platform whose timebase the next conversion reads afresh.
struct ScriptedClocks {
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    ScriptedClocks() { RKTime::resetTimebase(); }
    ~ScriptedClocks() { RKTime::resetTimebase(); }
};

}  // namespace

TEST(RKTime, TicksBecomeNanosecondsThroughATimebaseReadOnce) {
    ScriptedClocks clocks;
    clocks.platform->base = {125, 3};
    clocks.platform->clocks.absolute = 24000000;
    clocks.platform->clocks.continuous = 48000000;
    auto time = RKTime::now();
    ASSERT_TRUE(time);
    EXPECT_EQ(time->machAbsoluteTime(), 24000000u);
    EXPECT_EQ(time->machAbsoluteTimeNsec(), 1000000000u);
    EXPECT_EQ(time->machContinuousTimeNsec(), 2000000000u);
    clocks.platform->base = {1, 1};  // read once: a later change of the platform's answer is not seen
    EXPECT_EQ(time->machAbsoluteTimeNsec(), 1000000000u);
    EXPECT_EQ(clocks.platform->callCount("timebase"), 1u);

    RKTime::resetTimebase();
    EXPECT_EQ(time->machAbsoluteTimeNsec(), 24000000u);  // 1/1: nanoseconds are ticks

    // Multiplied before divided: 5 × 3 / 2 = 7, where dividing first would give 6.
    EXPECT_EQ(RKTime::convert(5, {3, 2}), 7u);
    EXPECT_EQ(RKTime::convert(5, {3, 0}), 0u);
}

TEST(RKTime, ConcurrentFirstConversionsReadTheTimebaseOnce) {
    ScriptedClocks clocks;
    clocks.platform->base = {125, 3};
    std::vector<std::thread> threads;
    std::vector<uint64_t> results(8);
    for (size_t i = 0; i < results.size(); i++)
        threads.emplace_back([&results, i] { results[i] = RKTime::toNanoseconds(3); });
    for (auto& thread : threads) thread.join();
    for (uint64_t result : results) EXPECT_EQ(result, 125u);
    EXPECT_EQ(clocks.platform->callCount("timebase"), 1u);
}

TEST(RKTime, WallTimeCountsFrom2001AndUnreadableClocksGiveNothing) {
    ScriptedClocks clocks;
    clocks.platform->clocks.wallSeconds = 978307200;
    clocks.platform->clocks.wallNanoseconds = 500000000;
    auto time = RKTime::now();
    ASSERT_TRUE(time);
    EXPECT_DOUBLE_EQ(time->wallTime(), 0.5);
    EXPECT_EQ(time->date().time_since_epoch(), std::chrono::milliseconds(978307200500));

    // A date far from 2001 keeps its sub-second part.
    RKClockReadings readings;
    readings.wallSeconds = 1700000000;
    readings.wallNanoseconds = 123000000;
    auto late = RKTime::fromReadings(readings).date();
    EXPECT_EQ(std::chrono::duration_cast<std::chrono::milliseconds>(late.time_since_epoch()).count(),
              1700000000123);

    clocks.platform->clocksFail = true;
    EXPECT_FALSE(RKTime::now());
}

TEST(RKTime, LinuxClocksNeverRunBackwardsAndTellTheWallTime) {
    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>());
    RKTime::resetTimebase();
    auto first = RKTime::now();
    auto second = RKTime::now();
    ASSERT_TRUE(first && second);
    EXPECT_GE(second->machAbsoluteTimeNsec(), first->machAbsoluteTimeNsec());
    EXPECT_GE(second->machContinuousTimeNsec(), first->machContinuousTimeNsec());
    EXPECT_GE(first->machContinuousTime(), first->machAbsoluteTime());  // boot time includes sleep
    double now = static_cast<double>(std::time(nullptr) - RKWallTimeEpochOffset);
    EXPECT_NEAR(first->wallTime(), now, 2.0);
    RKTime::resetTimebase();
}
