// Turns one smaps VMA into the region record of the walk: what kind of memory it is, its page
// counts, share mode, identity and tag. Pure: everything it needs of the system comes in the
// context, so it is tested on captured smaps text. docs/linux.md explains each rule.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/RKKernelTypes.h"
#include "platform/RKMountInfoParser.h"
#include "platform/RKSmapsParser.h"

enum class RKVmaKind : uint8_t {
    Anonymous,  // private anonymous, heap, stack
    Shmem,      // memfd, SysV, shared anonymous, tmpfs files
    Hugetlb,
    File,       // page cache of an ordinary file
    Device,     // VM_IO / VM_PFNMAP: no struct pages to count
    Special,    // the kernel's own mappings and other kernel objects
};

// What the classifier needs to know of the system and of the target.
struct RKVmaContext {
    pid_t pid = 0;
    uint64_t pageSize = 4096;
    // RKDeviceKey of the kernel's internal shmem mount; nothing when it could not be learnt.
    std::optional<uint64_t> shmemDevice;
    // The target's mount table (its own mount namespace); may be null.
    const RKMountTable* mounts = nullptr;
    // Inode of the target's IPC namespace (/proc/PID/ns/ipc); 0 when unknown.
    uint64_t ipcNamespace = 0;
};

// The true device and inode of a mapped file (stat of /proc/PID/map_files/START-END), which
// the maps line may not show (btrfs subvolumes, overlayfs).
struct RKFileIdentity {
    uint64_t device = 0;  // RKDeviceKey
    uint64_t inode = 0;
};

RKVmaKind RKClassifyVma(const RKSmapsVma& vma, const RKVmaContext& context);

// Whether classifying `vma` consults the mount table (so a device missing from it may mean
// the table is stale).
bool RKVmaNeedsMountTable(const RKSmapsVma& vma, const RKVmaContext& context);

// The region record of `vma`. `identity` replaces the maps line's device and inode of a file.
RKRegionSubmapInfo RKRegionInfoForVma(const RKSmapsVma& vma, RKVmaKind kind, const RKVmaContext& context,
                                      const std::optional<RKFileIdentity>& identity = std::nullopt);

// The user tag (RKLinuxTags.h) of a classified VMA.
uint32_t RKTagForVma(const RKSmapsVma& vma, RKVmaKind kind, const RKVmaContext& context);

// What the walk reports as the region's file name: the path of a file mapping as the kernel
// shows it; for other kinds the detail that tells mappings of one tag apart (a memfd's or a
// named anonymous mapping's NAME, a tmpfs file's path); empty when there is none.
std::string_view RKDetailForVma(const RKSmapsVma& vma, RKVmaKind kind);

// Identities. Object ids have the top bit set, private ids bit 62 (and not the top bit), so
// the two never meet each other, 0 or all ones.
uint64_t RKObjectIdForFile(uint8_t kindTag, uint64_t first, uint64_t second);
uint64_t RKPrivateObjectId(pid_t pid, uint64_t start, uint64_t pageSize);
// The bits of a pid that its private ids carry (the low 22).
uint32_t RKPrivateObjectIdPidBits(pid_t pid);
// Whether `id` is a private id carrying `pid`'s bits: only that process mints it, so it names
// memory that no process with other pid bits can map.
bool RKIsPrivateObjectIdOf(uint64_t id, pid_t pid);

// Kind tags mixed into object ids so that equal inode numbers of different kinds never meet.
inline constexpr uint8_t RKObjectKindFile = 1;
inline constexpr uint8_t RKObjectKindShmem = 2;
inline constexpr uint8_t RKObjectKindHugetlb = 3;
inline constexpr uint8_t RKObjectKindSysV = 4;
