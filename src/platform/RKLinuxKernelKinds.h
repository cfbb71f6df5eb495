// The kernel memory kinds (site tags) and counters this platform reports, named in one table
// each. A kind is one of /proc/meminfo's kernel lines turned into a wired site; a counter is a
// /proc/meminfo line reported as the kernel's auxiliary data under the line's own name.
#pragma once

#include <array>
#include <cstdint>
#include <string_view>

struct RKLinuxKernelKind {
    uint64_t tag;
    std::string_view name;     // the site's name in the report
    std::string_view meminfo;  // the /proc/meminfo line it comes from; empty when computed
};

// Tags of the wired sites of tag type. 24 is the tag of memory that user processes wired.
inline constexpr uint64_t RKKernelTagKernelStack = 1;
inline constexpr uint64_t RKKernelTagPageTables = 2;
inline constexpr uint64_t RKKernelTagSecPageTables = 3;
inline constexpr uint64_t RKKernelTagPercpu = 4;
inline constexpr uint64_t RKKernelTagVmallocOther = 5;
inline constexpr uint64_t RKKernelTagUserWired = 24;

inline constexpr std::array<RKLinuxKernelKind, 6> RKLinuxKernelKinds = {{
    {RKKernelTagKernelStack, "KernelStack", "KernelStack"},
    {RKKernelTagPageTables, "PageTables", "PageTables"},
    {RKKernelTagSecPageTables, "SecPageTables", "SecPageTables"},
    {RKKernelTagPercpu, "Percpu", "Percpu"},
    // VmallocUsed less what callers, modules and thread stacks account for.
    {RKKernelTagVmallocOther, "vmalloc (other)", ""},
    {RKKernelTagUserWired, "Mlocked", "Mlocked"},
}};

// The counters, numbered by position. The HugePages_ lines, which the kernel gives in pages,
// are reported in bytes (× Hugepagesize) like every other counter.
inline constexpr std::array<std::string_view, 37> RKLinuxKernelCounters = {
    "MemTotal",      "MemFree",         "MemAvailable",   "Buffers",         "Cached",
    "SwapCached",    "Active",          "Inactive",       "Unevictable",     "Mlocked",
    "SwapTotal",     "SwapFree",        "Zswap",          "Zswapped",        "Dirty",
    "Writeback",     "AnonPages",       "Mapped",         "Shmem",           "KReclaimable",
    "Slab",          "SReclaimable",    "SUnreclaim",     "KernelStack",     "PageTables",
    "SecPageTables", "VmallocUsed",     "Percpu",         "AnonHugePages",   "ShmemHugePages",
    "FileHugePages", "Hugetlb",         "HugePages_Total", "HugePages_Free", "HugePages_Rsvd",
    "HugePages_Surp", "Hugepagesize",
};

// The name of a tag or counter; empty when the table has none.
constexpr std::string_view RKLinuxKernelTagName(uint64_t tag) {
    for (const auto& kind : RKLinuxKernelKinds)
        if (kind.tag == tag) return kind.name;
    return {};
}
constexpr std::string_view RKLinuxKernelCounterName(uint64_t counter) {
    return counter < RKLinuxKernelCounters.size() ? RKLinuxKernelCounters[counter] : std::string_view{};
}
