// Reading one process's address space for the region walk: smaps read whole, parsed, and every
// VMA classified against the system (the shmem device) and the target (its mounts, its IPC
// namespace, the true identity of its mapped files).
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/RKLinuxTask.h"

// Reads and classifies `task`'s VMAs. KERN_SUCCESS and the snapshot; MACH_SEND_INVALID_DEST
// when the process is gone (or a zombie, whose smaps reads empty); KERN_PROTECTION_FAILURE
// when it may not be read; KERN_FAILURE otherwise.
kern_return_t RKLoadWalkSnapshot(RKLinuxTask& task, const std::string& procRoot, uint64_t pageSize,
                                 std::unique_ptr<RKLinuxWalkSnapshot>& snapshot);

// Gives the snapshot's text buffer back for reuse by the next read on this thread.
void RKRecycleWalkSnapshot(std::unique_ptr<RKLinuxWalkSnapshot> snapshot);

// The mount table of `task`'s mount namespace, shared with the walks of that namespace;
// `reread` reads the target's file again (a device missing from the table may be a new mount).
std::shared_ptr<const RKMountTable> RKMountTableForTask(RKLinuxTask& task, const std::string& procRoot,
                                                        bool reread = false);

// RKDeviceKey of the kernel's internal shmem mount, learnt once from a memfd of our own.
std::optional<uint64_t> RKShmemDevice();
// RKDeviceKey of the kernel's internal hugetlbfs mount (MFD_HUGETLB memfds), which no mountinfo
// lists; nothing where huge pages are not configured.
std::optional<uint64_t> RKInternalHugetlbDevice();
