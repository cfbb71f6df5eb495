// A live user process: construction takes its task, chooses its shared-region bounds and reads
// the figures that need no address space (phys memspread, ledgers, idle-exit status). Gathering
// (the walk of its address space) fills its regions; the snapshot source reuses the walk with
// sources of its own, so every source-specific step is overridable.
#pragma once

#include <memory>
#include <optional>
#include <vector>

#include "platform/RKPlatform.h"
#include "process/RKProcess.h"

class RKImage;

// Architectures that decide where the shared library cache is mapped.
enum RKPlatformCode : int32_t {
    RKPlatformI386 = 0,
    RKPlatformX86_64 = 1,
    RKPlatformArm = 2,
    RKPlatformArm64 = 3,
    RKPlatformArm64_32 = 4,
    RKPlatformUnknown = 5,
    RKPlatformLinux = 6,  // no shared library cache: the bounds stay 0
};

class RKUserProcess : public RKProcess {
public:
    RKUserProcess() = default;

    // The record's pid, translation, base initialisation (false without a task), shared-region
    // bounds, an empty image list, then phys memspread, ledgers and idle-exit status.
    bool initWithBsdInfo(const RKBsdInfo& info) override;
    // task_for_pid; on failure prints the platform's error and the process is not created.
    bool _populateTask() override;
    bool _isAlive() const override { return true; }

    // OVERRIDABLE STEP, NOT YET BUILT: the address-space walk that fills memoryRegions comes
    // with the region walk. Until then a user process gathers nothing and stays ungathered.
    void gatherData() override;

    // A live process is never translated on this platform; the snapshot source reads it.
    virtual void _gatherIsTranslated() {}
    // Sets the bounds of the given platform's shared region. False (after a message on standard
    // error) only for RKPlatformUnknown; codes past it change nothing.
    bool _setSharedRegionFromPlatform(int32_t platform);
    virtual void _gatherPhysMemspread();
    virtual void _gatherLedgers();
    virtual void _gatherIdleExitStatus();
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);

    RKTask* task() const { return task_.get(); }
    uint64_t sharedRegionBase() const { return sharedRegionBase_; }
    uint64_t sharedRegionSize() const { return sharedRegionSize_; }
    uint32_t sharedRegionAlignmentSize() const { return sharedRegionAlignmentSize_; }
    uint64_t phys_memspread() const { return phys_memspread_; }
    void setPhys_memspread(uint64_t value) { phys_memspread_ = value; }
    uint64_t phys_memspread_peak() const { return phys_memspread_peak_; }
    uint64_t ledgers() const { return ledgers_; }
    using RKImageList = std::vector<std::shared_ptr<RKImage>>;
    const std::optional<RKImageList>& images() const { return images_; }

protected:
    std::unique_ptr<RKTask> task_;
    uint64_t sharedRegionBase_ = 0;
    uint64_t sharedRegionSize_ = 0;
    uint32_t sharedRegionAlignmentSize_ = 0;
    uint64_t phys_memspread_ = 0;
    uint64_t phys_memspread_peak_ = 0;
    uint64_t ledgers_ = 0;
    std::optional<RKImageList> images_;  // exists from construction to the end of the walk
};
