// ISO 8601 dates for the document's time objects: local date and time with milliseconds and the
// zone offset, e.g. 2026-11-16T13:08:27.123+01:00 ("Z" for a zero offset).
#pragma once

#include <chrono>
#include <string>

class RKJsonDateFormatter {
public:
    // Reads the system time zone (TZ, else /etc/localtime) once, here.
    RKJsonDateFormatter();

    // Milliseconds are truncated, never rounded up into the next second.
    std::string stringFromDate(std::chrono::system_clock::time_point date) const;
};
