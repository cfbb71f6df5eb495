// The memory a Linux process holds without mapping it: the shmem objects (memfd, tmpfs and
// /dev/shm files, hugetlbfs files) and dma-bufs it holds open through descriptors, and the SysV
// segments it created that nobody maps. Each comes out as an owned-object record under the
// object id the region walk gives a mapping of the same object.
#pragma once

#include <memory>
#include <mutex>
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

// The SysV table as one gather sees it: the system's, not a process's, so read once while a
// gather is under way (the first process that needs it reads it, the others share that
// reading) and afresh on every use outside one. Safe to use from the gather's workers.
class RKSysVTableOfGather {
public:
    explicit RKSysVTableOfGather(std::string procRoot) : procRoot_(std::move(procRoot)) {}
    // Gathers may overlap: the table is kept until the last one ends.
    void begin();
    void end();
    // 0 and the segments (none when the table cannot be read), or the errno of its read.
    int segments(std::shared_ptr<const std::vector<RKSysVSegment>>& table);

private:
    const std::string procRoot_;
    std::mutex mutex_;
    int gathers_ = 0;
    std::shared_ptr<const std::vector<RKSysVSegment>> table_;  // read within the gathers
    int error_ = 0;
};

// 0 and the records; EACCES or EPERM when the descriptors may not be read; ESRCH when the
// process is gone. `procRoot` is the /proc the process is read under; `sysV`, the table its
// segments come from.
int RKReadOwnedObjects(RKLinuxTask& task, const std::string& procRoot, uint64_t pageSize, RKSysVTableOfGather& sysV,
                       std::vector<RKOwnedVmObjectRecord>& records);
