// The memory a Linux process holds without mapping it: the shmem objects (memfd, tmpfs and
// /dev/shm files, hugetlbfs files) and dma-bufs it holds open through descriptors, and the SysV
// segments it created that nobody maps. Each comes out as an owned-object record under the
// object id the region walk gives a mapping of the same object.
#pragma once

#include <string>
#include <vector>

#include "platform/RKKernelTypes.h"
#include "platform/RKLinuxTask.h"

// Kind tag of dma-buf object ids (the others are in RKLinuxVmaClassifier.h).
inline constexpr uint8_t RKObjectKindDmaBuf = 5;

// Ledger tag under which dma-bufs are listed (named "graphics").
inline constexpr uint32_t RKLedgerTagGraphics = 4;

// The system's SysV segments (/proc/sysvipc/shm under `procRoot`): 0, or the errno.
int RKReadSysVSegments(const std::string& procRoot, std::vector<RKSysVSegment>& segments);

// 0 and the records; EACCES or EPERM when the descriptors may not be read; ESRCH when the
// process is gone. `procRoot` is where the system's sysvipc table is read.
int RKReadOwnedObjects(RKLinuxTask& task, const std::string& procRoot, uint64_t pageSize,
                       std::vector<RKOwnedVmObjectRecord>& records);
