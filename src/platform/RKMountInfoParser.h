// /proc/PID/mountinfo as a table from device number to the kind of file system mounted there.
// Device numbers are decimal in mountinfo (hexadecimal in smaps).
#pragma once

#include <cstdint>
#include <string_view>
#include <unordered_map>

enum class RKMountKind : uint8_t {
    Tmpfs,      // shmem-backed files: memory the mappers cost, not page cache
    Hugetlbfs,  // huge pages
    Other,      // an ordinary file system
};

inline uint64_t RKDeviceKey(uint32_t major, uint32_t minor) {
    return static_cast<uint64_t>(major) << 32 | minor;
}

using RKMountTable = std::unordered_map<uint64_t, RKMountKind>;  // RKDeviceKey -> kind

// Lines that cannot be read are skipped. A device mounted several times keeps its first kind
// (a device is one superblock, so all its mounts share the file system type).
RKMountTable RKParseMountInfo(std::string_view text);
