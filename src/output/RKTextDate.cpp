#include "output/RKTextDate.h"

#include <cstdio>
#include <cstdlib>
#include <ctime>

namespace {

// Milliseconds are truncated, towards the past also before 1970.
int64_t floorMilliseconds(std::chrono::system_clock::time_point time) {
    return std::chrono::floor<std::chrono::milliseconds>(time.time_since_epoch()).count();
}

int64_t floorDivide(int64_t value, int64_t divisor) {
    int64_t quotient = value / divisor;
    return (value % divisor != 0 && value < 0) ? quotient - 1 : quotient;
}

}  // namespace

std::string RKTextIsoDate(std::chrono::system_clock::time_point time, long utcOffsetSeconds) {
    const int64_t milliseconds = floorMilliseconds(time);
    const int64_t seconds = floorDivide(milliseconds, 1000);
    const auto shifted = static_cast<time_t>(seconds + utcOffsetSeconds);
    struct tm fields {};
    if (!gmtime_r(&shifted, &fields)) return "?";

    char zone[8] = "Z";
    const long offsetMinutes = std::labs(utcOffsetSeconds) / 60;
    if (offsetMinutes != 0) {
        std::snprintf(zone, sizeof zone, "%c%02ld:%02ld", utcOffsetSeconds < 0 ? '-' : '+', offsetMinutes / 60 % 100,
                      offsetMinutes % 60);
    }
    char text[64];
    std::snprintf(text, sizeof text, "%04d-%02d-%02d %02d:%02d:%02d.%03d%s", fields.tm_year + 1900, fields.tm_mon + 1,
                  fields.tm_mday, fields.tm_hour, fields.tm_min, fields.tm_sec,
                  static_cast<int>(milliseconds - seconds * 1000), zone);
    return text;
}

std::string RKTextLocalIsoDate(std::chrono::system_clock::time_point time) {
    const auto seconds = static_cast<time_t>(floorDivide(floorMilliseconds(time), 1000));
    struct tm local {};
    if (!localtime_r(&seconds, &local)) return RKTextIsoDate(time, 0);
    return RKTextIsoDate(time, local.tm_gmtoff);
}
