// The user tags this platform gives its regions. One table: the names live with the region
// record (RKMemoryRegion::categoryNameForTag), the numbers here.
#pragma once

#include <cstdint>

enum RKLinuxTag : uint32_t {
    RKTagAnonymous = 0,         // private anonymous, unnamed or [anon:NAME]
    RKTagHeap = 1,              // [heap]
    RKTagStack = 30,            // [stack]
    RKTagSysVShm = 40,          // /SYSV…
    RKTagMemfd = 41,            // /memfd:NAME
    RKTagSharedAnonymous = 42,  // MAP_SHARED|MAP_ANONYMOUS, [anon_shmem:NAME]
    RKTagPosixShm = 43,         // files on tmpfs, /dev/shm
    RKTagHugetlb = 44,          // hugetlbfs and hugetlb mappings
    RKTagVdso = 50,
    RKTagVvar = 51,
    RKTagVsyscall = 52,
    RKTagUprobes = 53,
    RKTagDevice = 54,           // device mappings (VM_IO / VM_PFNMAP)
    RKTagKernelObject = 55,     // /secretmem, other major-0 devices
};
