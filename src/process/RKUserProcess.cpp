#include "process/RKUserProcess.h"

#include <cstdio>

namespace {

struct RKSharedRegionBounds {
    uint64_t base;
    uint64_t size;
};

// Indexed by RKPlatformCode, up to RKPlatformArm64_32.
constexpr RKSharedRegionBounds kSharedRegions[] = {
    {0x90000000, 0x20000000},       // RKPlatformI386
    {0x7FFF00000000, 0xFFE00000},   // RKPlatformX86_64
    {0x40000000, 0x40000000},       // RKPlatformArm
    {0x180000000, 0x100000000},     // RKPlatformArm64
    {0x1A000000, 0x40000000},       // RKPlatformArm64_32
};

}  // namespace

bool RKUserProcess::initWithBsdInfo(const RKBsdInfo& info) {
    setPid(info.pbi_pid);
    _gatherIsTranslated();
    if (!RKProcess::initWithBsdInfo(info)) return false;

    int32_t platform = RKPlatformLinux;
    if (RKPlatform::current().hasSharedRegion())
        platform = isTranslated() ? RKPlatformX86_64 : is64bit() ? RKPlatformArm64 : RKPlatformArm;
    _setSharedRegionFromPlatform(platform);

    images_.emplace();
    _gatherPhysMemspread();
    _gatherLedgers();
    _gatherIdleExitStatus();
    sharedRegionAlignmentSize_ = 4096;
    return true;
}

bool RKUserProcess::_populateTask() {
    kern_return_t result = RKPlatform::current().taskForPid(pid(), task_);
    if (result != KERN_SUCCESS) {
        mach_error("task_for_pid", result);
        return false;
    }
    return true;
}

void RKUserProcess::gatherData() {}

bool RKUserProcess::_setSharedRegionFromPlatform(int32_t platform) {
    if (platform >= 0 && platform <= RKPlatformArm64_32) {
        sharedRegionBase_ = kSharedRegions[platform].base;
        sharedRegionSize_ = kSharedRegions[platform].size;
        return true;
    }
    if (platform == RKPlatformUnknown) {
        std::fprintf(stderr, "Unable to determine platform architecture of target\n");
        return false;
    }
    return true;
}

void RKUserProcess::_gatherPhysMemspread() {
    if (!_isAlive() || !task_) return;
    RKRusageInfo usage;
    if (RKPlatform::current().pidRusage(*task_, usage) != 0) return;  // keep what was there
    phys_memspread_ = usage.ri_phys_memspread;
    phys_memspread_peak_ = usage.ri_lifetime_max_phys_memspread;
}

// The page-table ledger comes with the per-process figures of the walk.
void RKUserProcess::_gatherLedgers() {}

void RKUserProcess::_gatherIdleExitStatus() {
    if (!_isAlive()) return;
    _setIdleExitStatusFromDirtyFlags(RKPlatform::current().dirtyFlags(pid()));
}

void RKUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags) {
    constexpr uint32_t managed = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    if ((flags & managed) != managed)
        setIdleExitStatus(1);
    else
        setIdleExitStatus((flags & PROC_DIRTY_IS_DIRTY) ? 3 : 2);
}
