// The memory figures of /proc/PID/status, as plain numbers in kB.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

struct RKStatusFigures {
    uint64_t rssAnon = 0;
    uint64_t rssShmem = 0;
    uint64_t vmSwap = 0;
    uint64_t vmPTE = 0;
    uint64_t hugetlbPages = 0;
    uint64_t vmHWM = 0;
};

// Nothing when the text holds no memory figures at all: a zombie's or a kernel thread's
// status has no Vm lines.
std::optional<RKStatusFigures> RKParseStatusFigures(std::string_view text);
