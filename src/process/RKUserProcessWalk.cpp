// The address-space walk of a live user process and the regions built from it.
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "model/RKAssert.h"
#include "model/RKEscapedText.h"
#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKImage.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint32_t kRecordCountBeforeFullObjectId = 18;
constexpr uint64_t kBisectionGranularity = 0x1000000;  // 16 MiB

// Reserved ranges the kernel maps into every process; listed only in verbose output.
constexpr uint64_t kCommpageStart = 0xFC0000000;
constexpr uint64_t kCommpageSize = 0x40000000;
constexpr uint64_t kCarveoutStart = 0x1000000000;
constexpr uint64_t kCarveoutSize = 0x6000000000;

void printBailingOut(const std::string& displayString) {
    std::fprintf(stderr, "bailing out for process %s; data may be incomplete!\n",
                 RKEscapedText(displayString).c_str());
}

// strerror_r comes in two flavours; both end up as text here.
[[maybe_unused]] const char* errnoText(int result, const char* buffer) { return result == 0 ? buffer : "Unknown error"; }
[[maybe_unused]] const char* errnoText(const char* result, const char*) { return result; }

// The record of a shared-region entry, made from its top-level answer instead of a recursion.
RKRegionSubmapInfo sharedRegionRecord(const RKRegionBasicInfo& basic) {
    RKRegionSubmapInfo info;
    info.protection = basic.protection;
    info.max_protection = basic.max_protection;
    info.inheritance = basic.inheritance;
    info.offset = basic.offset;
    info.behavior = basic.behavior;
    info.user_wired_count = basic.user_wired_count;
    info.is_submap = basic.reserved;
    info.external_pager = 1;
    info.share_mode = SM_COW;
    info.object_id = 1;
    info.object_id_full = 1;
    return info;
}

}  // namespace

void RKUserProcess::gatherData() {
    if (memoryRegions()) return;
    if (!_reopenTaskForGathering()) return;
    if (!hiddenFromDisplay()) {
        _gatherImageData();
        _gatherPhysMemspread();
        ownedVmObjects_ = _gatherOwnedVmObjects();
    }
    _gatherMemoryData();
    images_.reset();
    _releaseTask();
}

uint64_t RKUserProcess::_lastNonSharedCacheRegion() {
    if (!task_ || sharedRegionSize_ == 0) return 0;
    const uint64_t page = pageSize() ? pageSize() : 4096;
    uint64_t lower = 0;
    uint64_t upper = sharedRegionBase_;
    do {
        uint64_t probe = lower / 2 + upper / 2;
        uint64_t address = probe;
        uint64_t size = 0;
        RKRegionBasicInfo basic;
        if (RKPlatform::current().region(*task_, address, size, basic) != KERN_SUCCESS) break;
        if (address == lower) break;
        if (address < sharedRegionBase_) {
            lower = address;
        } else {
            if (probe < page + lower) break;  // nothing left between the bounds
            upper = probe - page;
        }
    } while (upper > lower && upper - lower > kBisectionGranularity);
    return lower;
}

void RKUserProcess::enumerateRegions(const RKRegionCallback& callback) {
    if (!task_) return;
    const uint64_t last = _lastNonSharedCacheRegion();
    uint64_t address = 0;
    bool pseudoRegionSeen = false;
    while (_walkStep(address, last, pseudoRegionSeen, callback)) {
    }
}

bool RKUserProcess::_walkStep(uint64_t& address, uint64_t last, bool& pseudoRegionSeen,
                              const RKRegionCallback& callback) {
    RKPlatform& platform = RKPlatform::current();
    const uint64_t requested = address;
    const uint64_t sharedEnd = sharedRegionBase_ + sharedRegionSize_;
    uint64_t start = requested;
    uint64_t size = 0;
    RKRegionSubmapInfo info;
    kern_return_t result = KERN_SUCCESS;
    const char* failedCall = nullptr;

    // The shared region is read at the top level: its nested maps hold every process's cache.
    std::optional<RKRegionBasicInfo> topLevel;
    bool probeTop = (last != 0 && last <= requested && requested < sharedEnd) ||
                    (requested >= sharedRegionBase_ && requested < sharedEnd);
    if (probeTop) {
        RKRegionBasicInfo basic;
        result = platform.region(*task_, start, size, basic);
        if (result == KERN_INVALID_ADDRESS) return false;
        if (result != KERN_SUCCESS) {
            failedCall = "mach_vm_region";
        } else {
            if (start < requested) {  // the entry began below: keep its end
                size -= std::min(size, requested - start);
                start = requested;
            }
            topLevel = basic;
        }
    }
    bool inSharedRegion = topLevel && start >= last && start >= sharedRegionBase_ && start < sharedEnd;
    if (inSharedRegion) {
        info = sharedRegionRecord(*topLevel);
    } else if (!failedCall) {
        start = requested;
        uint32_t count = RK_REGION_SUBMAP_INFO_COUNT;
        result = platform.regionRecurse(*task_, start, size, info, count);
        if (result == KERN_INVALID_ADDRESS) return false;
        if (result == KERN_SUCCESS) {
            if (count <= kRecordCountBeforeFullObjectId) info.object_id_full = info.object_id;
            // Nothing after the owned-memory pseudo-region belongs to the address space.
            if (info.user_tag != RK_OWNED_MEMORY_TAG && pseudoRegionSeen) return false;
            // The bisection missed what lies below the shared region, so the recursion reached
            // into it: that entry's record must come from the top level all the same.
            if (start >= sharedRegionBase_ && start < sharedEnd) {
                RKRegionBasicInfo basic;
                const uint64_t entry = start;
                result = platform.region(*task_, start, size, basic);
                if (result == KERN_SUCCESS && start <= entry) {
                    size -= std::min(size, entry - start);
                    start = entry;
                    info = sharedRegionRecord(basic);
                    inSharedRegion = true;
                } else if (result != KERN_SUCCESS) {
                    failedCall = "mach_vm_region";
                }
            }
        } else {
            failedCall = "mach_vm_region_recurse";
        }
    }
    if (failedCall) {
        mach_error(failedCall, result);
        printBailingOut(displayString());
        _processMachVMError(result, MACH_SEND_INVALID_DEST);
        return false;
    }

    int purgeState = VM_PURGABLE_DENY;
    std::optional<std::string> path;
    if (!inSharedRegion) {
        if (platform.purgableState(*task_, start, purgeState) != KERN_SUCCESS) purgeState = VM_PURGABLE_DENY;
        RKAssert(info.is_submap == 0, "RKUserProcess", "!info.is_submap");
        if (info.user_tag == RK_OWNED_MEMORY_TAG) pseudoRegionSeen = true;
        if (info.external_pager != 0 && _isAlive()) path = platform.regionFileName(*task_, start);
    }
    if (callback(start, size, info, purgeState, path, std::nullopt, false)) return false;
    address = start + size;
    return address > requested;  // an empty or wrapping answer would never end
}

void RKUserProcess::_gatherMemoryData() {
    RKRegionWalkState state;
    state.hidden = hiddenFromDisplay();
    state.breakDown = breakDownPhysMemspread();
    state.sharingAnalysisDisabled = RKAnalysisSettings::isSharingAnalysisDisabled();
    state.forkSharingDisabled = RKAnalysisSettings::isForkSharingDisabled();
    if (images_) state.imageEnumerator = std::make_shared<RKImageEnumerator>(*images_);
    enumerateRegions([&](uint64_t start, uint64_t size, const RKRegionSubmapInfo& info, int purgeState,
                         const std::optional<std::string>& path, const std::optional<std::string>& name,
                         bool verbose) {
        return _addRegionForEntry(state, start, size, info, purgeState, path, name, verbose);
    });
    _addPendingSubranges(state);
    _gatherSharedAnonymousPages(state);
    _addUnconsumedOwnedObjectRegions(state);
    ownedVmObjects_.reset();
    _reconcileUnmappedOwnedRegion(state);
    _addPageTableRegion(state);
    setMemoryRegions(std::move(state.regions));
}

bool RKUserProcess::_addRegionForEntry(RKRegionWalkState& state, uint64_t start, uint64_t size,
                                       const RKRegionSubmapInfo& info, int purgeState,
                                       const std::optional<std::string>& path,
                                       const std::optional<std::string>& name, bool verbose) {
    if (start >= sharedRegionBase_ && start < sharedRegionBase_ + sharedRegionSize_) {
        if (state.hidden) return false;
        if (_addRegionsToArray(state, start, size, info)) return false;
        printBailingOut(displayString());
        return true;
    }
    const bool ownedPseudoRegion = purgeState != VM_PURGABLE_VOLATILE && purgeState != VM_PURGABLE_EMPTY &&
                                   info.user_tag == RK_OWNED_MEMORY_TAG;
    // The list accounts for that memory object by object. Asked before the region is made: a
    // region dropped stays in its block until the block goes (RKRegionBlocks.h).
    if (ownedPseudoRegion && ownedVmObjects_) return false;
    auto region = state.regionBlocks.make();
    region->start = start;
    region->size = size;
    region->user_tag = info.user_tag;
    region->object_id = info.object_id_full;
    region->share_mode = info.share_mode;
    region->offset = info.offset;
    region->wired = info.user_wired_count != 0;
    _setRegionSizes(*region, info, purgeState, state.breakDown);

    if (ownedPseudoRegion) {
        state.unmappedOwnedRegion = region;
        if (info.object_id_full == 0) region->object_id = info.object_id;
    }
    region->segment = RKSegmentNoImage;
    region->verbose = verbose;
    _nameRegion(*region, info, purgeState, path, name, state);
    _completeRegion(*region);

    _addSubrangesIfEligible(region, info, purgeState, state);
    if (region != state.unmappedOwnedRegion) state.regions.push_back(std::move(region));
    return false;
}

void RKUserProcess::_setRegionSizes(RKMemoryRegion& region, const RKRegionSubmapInfo& info, int purgeState,
                                    bool breakDown) const {
    const uint64_t page = pageSize();
    const uint64_t resident = info.pages_resident;
    const uint64_t reusable = info.pages_reusable;
    if (purgeState == VM_PURGABLE_EMPTY) {
        region.reclaimableSize = region.size;
        return;
    }
    if (purgeState == VM_PURGABLE_VOLATILE) {
        region.reclaimableSize = page * resident;
        return;
    }
    // Anonymous memory without the breakdown: every resident page that is not reusable is dirty.
    uint64_t dirtyPages = info.pages_dirtied;
    if (info.external_pager == 0 && !breakDown) dirtyPages = resident > reusable ? resident - reusable : 0;
    region.dirtySize = page * dirtyPages;
    region.reclaimableSize = page * reusable;
    region.swappedSize = page * info.pages_swapped_out;
    // Counters read at different moments can overlap; what they claim twice is not clean.
    region.cleanNonSpecSize = resident >= dirtyPages + reusable ? page * (resident - dirtyPages - reusable) : 0;
}

void RKUserProcess::_nameRegion(RKMemoryRegion& region, const RKRegionSubmapInfo& info, int purgeState,
                                const std::optional<std::string>& path, const std::optional<std::string>& name,
                                RKRegionWalkState& state) {
    if (_nameRegionFromImages(region, state)) return;
    if (name) {
        region.name = *name;
    } else if (path || info.external_pager != 0) {
        region.name = "mapped file";
        region.detailedName = path.value_or("");
    } else if (region.start == kCommpageStart && region.size == kCommpageSize) {
        region.name = "commpage (reserved)";
        region.verbose = true;
    } else if (region.start == kCarveoutStart && region.size == kCarveoutSize) {
        region.name = "GPU Carveout (reserved)";
        region.verbose = true;
    } else {
        if (region.user_tag != state.lastNamedTag) {
            state.lastTagName = RKMemoryRegion::categoryNameForTag(region.user_tag);
            state.lastNamedTag = region.user_tag;
        }
        region.name = state.lastTagName;
        // The platform names what tells regions of one tag apart (a memfd's name, a tmpfs
        // path); as the detail it keeps them apart in the report.
        if (_isAlive() && task_) region.detailedName = RKPlatform::current().regionFileName(*task_, region.start).value_or("");
        if (state.breakDown) _chargeOwnedObjectForRegion(region, info, purgeState, state);
    }
}

void RKUserProcess::_addPageTableRegion(RKRegionWalkState& state) const {
    if (!state.breakDown || ledgers_ == 0) return;
    auto region = state.regionBlocks.make();
    region->size = ledgers_;
    region->dirtySize = ledgers_;
    region->start = RKRegionNoAddress;
    region->name = "page table";
    region->object_id = 0xFFFFFFFFFFFFFFFFull;
    region->share_mode = SM_PRIVATE;
    state.regions.push_back(std::move(region));
}

void RKUserProcess::_processMachVMError(kern_return_t error, kern_return_t expected) {
    std::string suffix;
    bool exited = false;
    bool zombie = false;
    if (error == expected && _isAlive()) {
        uint32_t status = 0;
        // Through the task: the pid may already name another process.
        int result = task_ ? RKPlatform::current().taskShortBsdInfoStatus(*task_, status)
                           : RKPlatform::current().shortBsdInfoStatus(pid(), status);
        exited = result == ESRCH;
        if (result == 0 && status == SZOMB) {
            zombie = true;
            suffix = " (zombie)";
        } else if (exited) {
            suffix = " (process exited)";
        }
    }
    std::string message = displayString() + ": " + mach_error_string(error) + suffix;
    (exited || zombie ? warnings_ : errors_).push_back(std::move(message));
}

void RKUserProcess::_addErrnoWarningWithDescription(const std::string& description) {
    int error = errno;
    char buffer[256] = {};
    const char* text = errnoText(strerror_r(error, buffer, sizeof buffer), buffer);
    std::string message = displayString() + ": " + description + " - " + text;
    std::fprintf(stderr, "%s\n", RKEscapedText(message).c_str());
    warnings_.push_back(std::move(message));
}

// ---- Steps that later sources of the process's memory fill in ----

