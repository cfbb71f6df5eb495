// One instant read on three clocks at once: the uptime clock, the clock that keeps counting
// during sleep, and the wall clock. Immutable; readable from any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>

#include "platform/RKKernelTypes.h"

// Seconds from 1970-01-01 to 2001-01-01, the epoch of wallTime.
inline constexpr int64_t RKWallTimeEpochOffset = 978307200;

class RKTime {
public:
    // now: the present instant, or nothing when the clocks cannot be read.
    static std::optional<RKTime> now();
    // A timestamp from readings already taken (for snapshots and tests).
    static RKTime fromReadings(const RKClockReadings& readings);

    uint64_t machAbsoluteTime() const { return machAbsoluteTime_; }
    uint64_t machContinuousTime() const { return machContinuousTime_; }
    double wallTime() const { return wallTime_; }  // seconds since 2001-01-01 00:00:00 UTC
    uint64_t machAbsoluteTimeNsec() const { return toNanoseconds(machAbsoluteTime_); }
    uint64_t machContinuousTimeNsec() const { return toNanoseconds(machContinuousTime_); }
    std::chrono::system_clock::time_point date() const;

    // ticks × numer / denom, multiplied first; 0 when denom is 0. The platform's timebase is
    // read once for the whole program, by whichever thread converts first.
    static uint64_t toNanoseconds(uint64_t ticks);
    static uint64_t convert(uint64_t ticks, const RKTimebase& timebase);
    // Forgets the timebase so that the next conversion reads it again (tests that install a
    // platform with another timebase).
    static void resetTimebase();

private:
    RKTime() = default;
    uint64_t machAbsoluteTime_ = 0;
    uint64_t machContinuousTime_ = 0;
    double wallTime_ = 0;
};
