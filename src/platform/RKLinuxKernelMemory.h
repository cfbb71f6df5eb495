// The kernel's memory records built from the text of /proc files (docs/linux.md, "The
// kernel"). Pure: the Linux platform reads the files and hands them over, tests hand over
// captured ones.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string_view>

#include "platform/RKKernelMemoryInfo.h"

struct RKKernelMemorySources {
    std::string_view meminfo;
    std::optional<std::string_view> slabinfo;     // nothing: not readable (root only)
    std::optional<std::string_view> vmallocinfo;  // nothing: not readable (root only)
    std::optional<std::string_view> modules;      // nothing: a kernel without modules
    // Whether the slab cache of that name is marked reclaim_account (its objects are freed by
    // shrinkers under memory pressure).
    std::function<bool(std::string_view cache)> isReclaimable;
    uint64_t pageSize = 4096;
    bool restricted = false;  // a source was refused for lack of privileges
};

// Nothing when the meminfo text holds no figures.
std::optional<RKKernelMemoryInfo> RKKernelMemoryFromSources(const RKKernelMemorySources& sources);
