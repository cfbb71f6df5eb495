#include "model/RKTime.h"

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
    auto sinceEpoch = duration<double>(wallTime_ + static_cast<double>(RKWallTimeEpochOffset));
    return system_clock::time_point(duration_cast<system_clock::duration>(sinceEpoch));
}

uint64_t RKTime::convert(uint64_t ticks, const RKTimebase& timebase) {
    if (timebase.denom == 0) return 0;
    return ticks * timebase.numer / timebase.denom;
}

uint64_t RKTime::toNanoseconds(uint64_t ticks) {
    static const RKTimebase timebase = RKPlatform::current().timebase();
    return convert(ticks, timebase);
}
