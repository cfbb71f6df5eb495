// One VM object as all measured processes see it: the regions, from any number of processes,
// that map it, and its dirty, swapped, clean, reclaimable and wired totals.
//
// Lifecycle: collecting (regions are added, their sizes merged by object offset so overlapping
// mappings count once), then finalized exactly once (totals fixed, range list gone). During
// output each object is asked for its view for a process, which differs from the object when
// processes map different parts of it or when another process owns it.
//
// Objects are always held by std::shared_ptr: a view may be the object itself.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "model/RKObjectRegions.h"
#include "model/RKRangeList.h"
#include "process/RKProcess.h"

class RKMemoryObject : public std::enable_shared_from_this<RKMemoryObject> {
public:
    RKMemoryObject();  // no regions, no owner, all totals 0
    ~RKMemoryObject();  // its regions stop pointing at it
    RKMemoryObject(const RKMemoryObject&) = delete;
    RKMemoryObject& operator=(const RKMemoryObject&) = delete;

    // ---- Collecting ----
    // On behalf of `process`, with its page size; per-process views become possible.
    void addRegion(const std::shared_ptr<RKMemoryRegion>& region, const RKProcess& process);
    // On behalf of no process (sharing analysis off, or building a view).
    void addRegion(const std::shared_ptr<RKMemoryRegion>& region, uint64_t pageSize);
    // The common intake. Regions with object_id 0 are listed but add no sizes. The region's
    // subranges are merged and then dropped.
    void _addRegion(const std::shared_ptr<RKMemoryRegion>& region, uint64_t pageSize, const RKProcess* process);

    // ---- Finalizing (once; a second call or a later addRegion stops the program) ----
    void finalize() { finalizeUsingRegionDirtySize(false); }
    // useRegionDirtySize: dirty and swapped are the regions' own sums rather than the merged
    // ranges' (the per-process accounting of owned memory).
    void finalizeUsingRegionDirtySize(bool useRegionDirtySize);

    // ---- Output ----
    // The object as `process` sees it: this object itself, or a new finalized object. A process
    // that maps memory another process owns sees its dirty and swapped bytes as clean.
    std::shared_ptr<RKMemoryObject> viewForProcess(const RKProcess& process);
    // A new finalized object with the same totals (reclaimable excepted: 0), owner and region
    // list (shared, not duplicated), without per-process views. Only for finalized objects.
    std::shared_ptr<RKMemoryObject> copy() const;

    uint64_t totalDirtySize() const { return totalDirtySize_; }
    uint64_t totalCleanSize() const { return totalCleanSize_; }
    uint64_t totalSwappedSize() const { return totalSwappedSize_; }
    uint64_t totalReclaimableSize() const { return totalReclaimableSize_; }
    uint64_t totalWiredSize() const { return totalWiredSize_; }
    bool accurateSizes() const { return accurateSizes_; }  // finalized
    pid_t ownerPid() const { return ownerPid_; }           // -1: no owner
    void setOwnerPid(pid_t pid) { ownerPid_ = pid; }

    const RKObjectRegions& memoryRegions() const { return memoryRegions_; }
    // Per process, while two or more have regions since the views began (see RKObjectRegions).
    const RKProcessRegionMap* processMemoryRegions() const { return _processRegions(); }

    // Names come from the canonical region; empty for an object without regions.
    const std::string& name() const;
    const std::string& detailedName() const;
    std::string fullName() const;
    bool verbose() const;  // of the first region
    bool containsFakeRegion() const { return containsFakeRegion_; }
    bool couldHaveProcessView() const;
    // The region that names the object, or null when it has none.
    const RKMemoryRegion* _canonicalRegion() const;

private:
    // Held in the regions' extras (see RKObjectRegions), so null while there is one region.
    RKRangeList* _rangeList() const;
    RKProcessRegionMap* _processRegions() const;
    // The extras, which the second region made; stops the program when there are none.
    RKObjectRegions::Extras& _extras();
    bool _keepsProcessViews() const;
    void _raiseToProcessSums();
    void _nameFakeRegions();
    void _mergeSoleRegion(RKRangeList& into);
    void _addToProcessViews(const std::shared_ptr<RKMemoryRegion>& region, pid_t pid);

    // One object per mapping at most: widest fields first, counts and indexes in 32 bits, and
    // what only objects of two or more regions need (the range list, the per-process regions) in
    // the block that their second region brings. 104 bytes: with the shared_ptr control block and
    // glibc's header, a 128-byte chunk.
    uint64_t totalDirtySize_ = 0;
    uint64_t totalCleanSize_ = 0;
    uint64_t totalSwappedSize_ = 0;
    uint64_t totalReclaimableSize_ = 0;
    uint64_t totalWiredSize_ = 0;
    RKObjectRegions memoryRegions_;
    pid_t ownerPid_ = -1;
    static constexpr uint32_t kNone = UINT32_MAX;
    uint32_t viewsFrom_ = kNone;  // in memoryRegions_, until finalized
    pid_t viewsPid_ = 0;          // of the regions since then, while there is no map
    // In memoryRegions_: the one region with pages while there is no range list.
    uint32_t soleRegion_ = kNone;
    uint32_t soleRegionPageSize_ = 0;
    bool accurateSizes_ : 1 = false;
    bool containsFakeRegion_ : 1 = false;
};
