// Helpers for the JSON document tests.
#pragma once

#include <time.h>

#include <cstdlib>
#include <optional>
#include <string>

// Sets TZ (a POSIX zone string such as "UTC0" or "<+0530>-5:30", which needs no zone files)
// for one test, and puts the previous zone back.
class ScopedTimeZone {
public:
    explicit ScopedTimeZone(const char* zone) {
        if (const char* previous = std::getenv("TZ")) previous_ = previous;
        setenv("TZ", zone, 1);
        tzset();
    }
    ~ScopedTimeZone() {
        if (previous_) {
            setenv("TZ", previous_->c_str(), 1);
        } else {
            unsetenv("TZ");
        }
        tzset();
    }
    ScopedTimeZone(const ScopedTimeZone&) = delete;
    ScopedTimeZone& operator=(const ScopedTimeZone&) = delete;

private:
    std::optional<std::string> previous_;
};
