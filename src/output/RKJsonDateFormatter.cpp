#include "output/RKJsonDateFormatter.h"

#include <time.h>

#include <cstdio>
#include <cstdlib>

RKJsonDateFormatter::RKJsonDateFormatter() {
    // localtime_r is not required to look at the zone again; tzset makes it current.
    tzset();
}

std::string RKJsonDateFormatter::stringFromDate(std::chrono::system_clock::time_point date) const {
    using namespace std::chrono;
    const auto milliseconds = floor<std::chrono::milliseconds>(date).time_since_epoch().count();
    // Floor division, so that dates before 1970 keep a millisecond part in 0...999.
    time_t seconds = static_cast<time_t>(milliseconds / 1000);
    long fraction = static_cast<long>(milliseconds % 1000);
    if (fraction < 0) {
        fraction += 1000;
        seconds -= 1;
    }
    struct tm local {};
    if (!localtime_r(&seconds, &local)) return std::string();

    char text[64];
    int length = std::snprintf(text, sizeof text, "%04d-%02d-%02dT%02d:%02d:%02d.%03ld", local.tm_year + 1900,
                               local.tm_mon + 1, local.tm_mday, local.tm_hour, local.tm_min, local.tm_sec, fraction);
    std::string result(text, static_cast<size_t>(length));
    const long offsetMinutes = local.tm_gmtoff / 60;
    if (offsetMinutes == 0) return result + "Z";
    const long magnitude = std::labs(offsetMinutes);
    std::snprintf(text, sizeof text, "%c%02ld:%02ld", offsetMinutes < 0 ? '-' : '+', magnitude / 60, magnitude % 60);
    return result + text;
}
