#include "model/RKTime.h"

#include <atomic>
#include <cmath>
#include <mutex>

#include "platform/RKPlatform.h"

std::optional<RKTime> RKTime::now() {
    RKClockReadings readings;
    if (!RKPlatform::current().getTimes(readings)) return std::nullopt;
    return fromReadings(readings);
}

RKTime RKTime::fromReadings(const RKClockReadings& readings) {
    RKTime time;
    time.machAbsoluteTime_ = readings.absolute;
    time.machContinuousTime_ = readings.continuous;
    time.wallTime_ = static_cast<double>(readings.wallSeconds - RKWallTimeEpochOffset) +
                     static_cast<double>(readings.wallNanoseconds) * 1e-9;
    return time;
}

std::chrono::system_clock::time_point RKTime::date() const {
    using namespace std::chrono;
    // Whole seconds as integers, so the 1970 offset costs no precision of the fraction.
    double whole = std::floor(wallTime_);
    auto fraction = duration_cast<system_clock::duration>(duration<double>(wallTime_ - whole));
    return system_clock::time_point(seconds(static_cast<int64_t>(whole) + RKWallTimeEpochOffset)) + fraction;
}

uint64_t RKTime::convert(uint64_t ticks, const RKTimebase& timebase) {
    if (timebase.denom == 0) return 0;
    return ticks * timebase.numer / timebase.denom;
}

namespace {

// The timebase, read at most once until reset: the flag is read without the lock, so
// conversions after the first never wait.
struct TimebaseCache {
    std::mutex mutex;
    std::atomic<bool> known{false};
    RKTimebase timebase;
};

TimebaseCache& timebaseCache() {
    static TimebaseCache cache;
    return cache;
}

RKTimebase currentTimebase() {
    TimebaseCache& cache = timebaseCache();
    if (cache.known.load(std::memory_order_acquire)) return cache.timebase;
    std::lock_guard<std::mutex> lock(cache.mutex);
    if (!cache.known.load(std::memory_order_relaxed)) {
        cache.timebase = RKPlatform::current().timebase();
        cache.known.store(true, std::memory_order_release);
    }
    return cache.timebase;
}

}  // namespace

uint64_t RKTime::toNanoseconds(uint64_t ticks) { return convert(ticks, currentTimebase()); }

void RKTime::resetTimebase() {
    TimebaseCache& cache = timebaseCache();
    std::lock_guard<std::mutex> lock(cache.mutex);
    cache.known.store(false, std::memory_order_release);
}
