// The timestamp of the "Time:" line: ISO 8601 with milliseconds and the zone offset,
// e.g. "2026-11-16 13:08:27.123+01:00", or "...Z" in UTC.
#pragma once

#include <chrono>
#include <string>

// `time` as seen `utcOffsetSeconds` east of UTC (only whole minutes of the offset are written).
std::string RKTextIsoDate(std::chrono::system_clock::time_point time, long utcOffsetSeconds);

// `time` in the system's time zone, with the offset that zone had at that instant.
std::string RKTextLocalIsoDate(std::chrono::system_clock::time_point time);
