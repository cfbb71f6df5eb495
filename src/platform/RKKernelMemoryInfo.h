// The kernel's own accounting of its memory, as mach_memory_info answers it: zone allocators
// (their names and records), wired-memory sites and counters, plus the loaded modules that
// name module sites. On Linux the platform fills them from /proc (docs/linux.md, "The kernel").
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

inline constexpr size_t RK_ZONE_NAME_MAX = 80;

// mach_zone_name_t: not necessarily NUL-terminated.
struct RKZoneName {
    char mzn_name[RK_ZONE_NAME_MAX] = {};
};

// mach_zone_info_t.
struct RKZoneInfo {
    uint64_t mzi_count = 0;        // elements in use
    uint64_t mzi_cur_size = 0;     // bytes the zone holds
    uint64_t mzi_max_size = 0;
    uint64_t mzi_elem_size = 0;
    uint64_t mzi_alloc_size = 0;   // bytes the zone grows by
    uint64_t mzi_sum_size = 0;
    uint64_t mzi_exhaustible = 0;
    uint64_t mzi_collectable = 0;  // not 0: the kernel frees its unused elements under pressure
};

// Site types (flags & 0xFF) and flag bits of a site record.
inline constexpr uint64_t VM_KERN_SITE_TYPE = 0xFF;
inline constexpr uint64_t VM_KERN_SITE_TAG = 0;
inline constexpr uint64_t VM_KERN_SITE_KMOD = 1;
inline constexpr uint64_t VM_KERN_SITE_KERNEL = 2;
inline constexpr uint64_t VM_KERN_SITE_COUNTER = 3;
inline constexpr uint64_t VM_KERN_SITE_WIRED = 0x100;
inline constexpr uint64_t VM_KERN_SITE_HIDE = 0x200;
inline constexpr uint64_t VM_KERN_SITE_NAMED = 0x400;
inline constexpr uint64_t VM_KERN_SITE_ZONE = 0x800;

// mach_memory_info_t. `detail` is this platform's addition: a note on the site that the report
// shows as its detailed name (empty for most).
struct RKMemoryInfoRecord {
    uint64_t flags = 0;
    uint64_t site = 0;  // tag, module load tag, address or counter number, by type
    uint64_t size = 0;
    uint64_t free = 0;
    uint64_t largest = 0;
    uint64_t collectable_bytes = 0;
    uint64_t mapped = 0;  // a counter's value
    uint64_t peak = 0;
    uint16_t tag = 0;
    uint16_t zone = 0;  // index into the zone names, with VM_KERN_SITE_ZONE
    char name[RK_ZONE_NAME_MAX] = {};
    std::string detail;
};

struct RKKernelMemoryInfo {
    std::vector<RKZoneName> zoneNames;
    std::vector<RKZoneInfo> zones;  // zones[i] belongs to zoneNames[i]
    std::vector<RKMemoryInfoRecord> sites;
    // Loaded modules by load tag (the kmod sites' `site`): their names.
    std::map<uint64_t, std::string> modules;
    // Some of the kernel's accounting needs privileges the caller lacks (on Linux: the slab
    // caches and the vmalloc callers); what was answered is the part anyone may read.
    bool restricted = false;
};
