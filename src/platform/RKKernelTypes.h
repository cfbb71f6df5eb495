// The records and codes that cross the platform seam. Their field names are the kernel
// interface names the analysis was designed around; on Linux the platform layer fills them
// from /proc (docs/linux.md).
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>

using kern_return_t = int32_t;

inline constexpr kern_return_t KERN_SUCCESS = 0;
inline constexpr kern_return_t KERN_INVALID_ADDRESS = 1;   // past the last region
inline constexpr kern_return_t KERN_PROTECTION_FAILURE = 2;
inline constexpr kern_return_t KERN_INVALID_ARGUMENT = 4;  // a page query of a process that is gone
inline constexpr kern_return_t KERN_FAILURE = 5;
inline constexpr kern_return_t KERN_RESOURCE_SHORTAGE = 6;  // out of file descriptors
inline constexpr kern_return_t KERN_NOT_SUPPORTED = 46;      // the system cannot tell (frames hidden)
inline constexpr kern_return_t MACH_SEND_INVALID_DEST = 0x10000003;  // the process is gone

// pbi_flags bits.
inline constexpr uint32_t PROC_FLAG_SYSTEM = 0x1;
inline constexpr uint32_t PROC_FLAG_LP64 = 0x10;
// pbsi_status of a zombie.
inline constexpr uint32_t SZOMB = 5;
// Idle-exit tracking flags.
inline constexpr uint32_t PROC_DIRTY_TRACKED = 0x1;
inline constexpr uint32_t PROC_DIRTY_ALLOWS_IDLE_EXIT = 0x2;
inline constexpr uint32_t PROC_DIRTY_IS_DIRTY = 0x4;

inline constexpr size_t MAXCOMLEN = 16;

// proc_bsdinfo: the fields memspread reads. Names are NUL-terminated within their arrays.
struct RKBsdInfo {
    uint32_t pbi_flags = 0;
    uint32_t pbi_status = 0;
    pid_t pbi_pid = 0;
    pid_t pbi_ppid = 0;
    char pbi_comm[MAXCOMLEN + 1] = {};
    char pbi_name[2 * MAXCOMLEN + 1] = {};
    // When the process started (on Linux: since boot). Two records of one pid with different
    // start times are two processes.
    uint64_t pbi_start_tvsec = 0;
    uint64_t pbi_start_tvusec = 0;
};

// Share modes of a region record.
inline constexpr uint8_t SM_COW = 1;
inline constexpr uint8_t SM_PRIVATE = 2;
inline constexpr uint8_t SM_EMPTY = 3;
inline constexpr uint8_t SM_SHARED = 4;
inline constexpr uint8_t SM_TRUESHARED = 5;
inline constexpr uint8_t SM_PRIVATE_ALIASED = 6;
inline constexpr uint8_t SM_SHARED_ALIASED = 7;
inline constexpr uint8_t SM_LARGE_PAGE = 8;

// Purge states.
inline constexpr int VM_PURGABLE_NONVOLATILE = 0;
inline constexpr int VM_PURGABLE_VOLATILE = 1;
inline constexpr int VM_PURGABLE_EMPTY = 2;
inline constexpr int VM_PURGABLE_DENY = 3;

// protection / max_protection bits of a region record.
inline constexpr int32_t VM_PROT_READ = 0x1;
inline constexpr int32_t VM_PROT_WRITE = 0x2;
inline constexpr int32_t VM_PROT_EXECUTE = 0x4;
// inheritance of a region record.
inline constexpr uint32_t VM_INHERIT_SHARE = 0;
inline constexpr uint32_t VM_INHERIT_COPY = 1;
inline constexpr uint32_t VM_INHERIT_NONE = 2;

// The tag of the kernel's owned-memory pseudo-region.
inline constexpr uint32_t RK_OWNED_MEMORY_TAG = 0xFFFFFFFF;

// vm_region_submap_info_64 (19 words).
struct RKRegionSubmapInfo {
    int32_t protection = 0;
    int32_t max_protection = 0;
    uint32_t inheritance = 0;
    uint64_t offset = 0;
    uint32_t user_tag = 0;
    uint32_t pages_resident = 0;
    uint32_t pages_shared_now_private = 0;
    uint32_t pages_swapped_out = 0;
    uint32_t pages_dirtied = 0;
    uint32_t ref_count = 0;
    uint16_t shadow_depth = 0;
    uint8_t external_pager = 0;
    uint8_t share_mode = 0;
    uint32_t is_submap = 0;
    int32_t behavior = 0;
    uint32_t object_id = 0;
    uint16_t user_wired_count = 0;
    uint32_t pages_reusable = 0;
    uint64_t object_id_full = 0;
};
inline constexpr uint32_t RK_REGION_SUBMAP_INFO_COUNT = 19;

// vm_region_basic_info_64.
struct RKRegionBasicInfo {
    int32_t protection = 0;
    int32_t max_protection = 0;
    uint32_t inheritance = 0;
    uint32_t shared = 0;
    uint32_t reserved = 0;  // the kernel's submap flag
    uint64_t offset = 0;
    int32_t behavior = 0;
    uint16_t user_wired_count = 0;
};

// Page disposition bits of a page-range query.
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_PRESENT = 0x1;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_FICTITIOUS = 0x2;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_REF = 0x4;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_DIRTY = 0x8;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_PAGED_OUT = 0x10;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_COPIED = 0x20;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_SPECULATIVE = 0x40;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_EXTERNAL = 0x80;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_CS_VALIDATED = 0x100;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_CS_TAINTED = 0x200;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_CS_NX = 0x400;
inline constexpr uint32_t VM_PAGE_QUERY_PAGE_REUSABLE = 0x800;

// proc_pid_rusage: the two figures memspread reads.
struct RKRusageInfo {
    uint64_t ri_phys_memspread = 0;
    uint64_t ri_lifetime_max_phys_memspread = 0;
};

// One record of vm.get_owned_vmobjects.
struct RKOwnedVmObjectRecord {
    uint64_t object_id = 0;
    uint64_t virtual_size = 0;
    uint64_t resident_size = 0;
    uint64_t wired_size = 0;
    uint64_t reusable_size = 0;
    uint64_t compressed_size = 0;
    uint32_t flags = 0;  // bit 0 vo_no_memspread, bits 1-3 vo_ledger_tag, bits 4-5 purgable
    std::string detail;  // what tells the object apart (a memfd's name, a path); may be empty
};

// One SysV shared memory segment of the system (a line of /proc/sysvipc/shm). Sizes are in
// bytes; resident and swapped count the segment's own pages, whoever touched them.
struct RKSysVSegment {
    int64_t shmid = 0;
    uint64_t size = 0;
    pid_t creator = 0;      // cpid, in the reader's pid namespace
    uint64_t attached = 0;  // nattch: the number of mappings
    uint64_t resident = 0;
    uint64_t swapped = 0;
};

// One segment of one loaded image, as the platform's image lister reports it (the symbol
// library's owners and segments elsewhere; on Linux the mappings of executable files).
struct RKImageSegmentRecord {
    std::string path;       // of the image file
    uint64_t baseAddress = 0;  // the image's load address
    uint64_t start = 0;
    uint64_t size = 0;
    std::string name;       // the segment's name
    // The segment code (2 text, 3 data, 4 link-edit) when the platform knows it; 0 when the
    // name decides.
    uint8_t segment = 0;
};

// mach_get_times.
struct RKClockReadings {
    uint64_t absolute = 0;    // ticks of the uptime clock
    uint64_t continuous = 0;  // ticks of the clock that counts during sleep
    int64_t wallSeconds = 0;  // since 1970-01-01 00:00:00 UTC
    int64_t wallNanoseconds = 0;
};

struct RKTimebase {
    uint32_t numer = 1;
    uint32_t denom = 1;
};

// One range whose page dispositions will be asked for, with what the region walk knows of it:
// whether its pages are a file's (a clean file page is not memory), and how many of its pages
// at most were lazily freed (the kernel keeps that count per mapping only).
struct RKPageQueryRange {
    uint64_t start = 0;
    uint64_t size = 0;
    bool fileBacked = false;
    uint64_t reusablePages = 0;
    // Pages the walk saw resident or swapped in the range: where that is every page, there is no
    // hole for a scan to skip, and it sizes what the reading keeps.
    uint64_t presentPages = 0;
};

// What this system's page queries see.
struct RKPageQueryAbilities {
    // Dirty file pages are told from clean ones (on Linux: /proc/kpageflags is readable).
    bool dirtyFilePages = true;
    // Physical frame numbers are visible, so pages can be identified across processes.
    bool frames = false;
};

inline constexpr uint64_t RKSwappedPageKey = 1ull << 63;

// A page of private anonymous memory that other mappings may hold too (after fork, or merged
// by KSM): its identity and the range it was found in. `page()` is the frame number of a
// present page, or the swap entry of a swapped one with RKSwappedPageKey set. The key is kept
// in two halves so that a record takes 12 bytes, not 16: a forking server has millions.
struct RKSharedAnonymousPage {
    uint32_t pageLow = 0;
    uint32_t pageHigh = 0;
    uint32_t range = 0;  // index in the ranges asked about

    RKSharedAnonymousPage() = default;
    RKSharedAnonymousPage(uint64_t key, uint32_t inRange)
        : pageLow(static_cast<uint32_t>(key)), pageHigh(static_cast<uint32_t>(key >> 32)), range(inRange) {}
    uint64_t page() const { return uint64_t{pageHigh} << 32 | pageLow; }
    bool swapped() const { return (page() & RKSwappedPageKey) != 0; }
};
static_assert(sizeof(RKSharedAnonymousPage) == 12);
