// The region walk on Linux: /proc/PID/smaps read once when a walk starts (at address 0) and
// every later call answered from that snapshot by binary search.
#include <algorithm>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTask.h"
#include "platform/RKLinuxWalk.h"

namespace {

RKLinuxTask* linuxTask(RKTask& task) { return dynamic_cast<RKLinuxTask*>(&task); }

// The first region ending above `address`, or nullptr. The region found last, or the one after
// it, is the answer of nearly every lookup of a walk; others are searched for.
const RKLinuxRegion* regionEndingAbove(const RKLinuxWalkSnapshot& snapshot, uint64_t address) {
    const auto& regions = snapshot.regions;
    auto isAnswer = [&](size_t i) {
        return i < regions.size() && address < regions[i].vma.end && (i == 0 || regions[i - 1].vma.end <= address);
    };
    size_t found = snapshot.lastFound;
    if (!isAnswer(found) && !isAnswer(++found)) {
        auto it = std::upper_bound(regions.begin(), regions.end(), address,
                                   [](uint64_t a, const RKLinuxRegion& r) { return a < r.vma.end; });
        found = static_cast<size_t>(it - regions.begin());
    }
    if (found == regions.size()) return nullptr;
    snapshot.lastFound = found;
    return &regions[found];
}

const RKLinuxRegion* regionContaining(const RKLinuxWalkSnapshot& snapshot, uint64_t address) {
    const RKLinuxRegion* region = regionEndingAbove(snapshot, address);
    return region && region->vma.start <= address ? region : nullptr;
}

// Anonymous pages of a private mapping that other mappings hold too, in kB: every shared page of
// anonymous memory; of a file or shmem object, the shared copies written through the mapping
// (dirty, and no more than its anonymous pages: its page cache is no anonymous memory).
uint64_t sharedAnonymousKB(const RKLinuxRegion& region) {
    if (region.vma.perms & RKSmapsShared) return 0;
    switch (region.kind) {
        case RKVmaKind::Anonymous: return region.vma.sharedClean + region.vma.sharedDirty;
        case RKVmaKind::File:
        case RKVmaKind::Shmem: return std::min(region.vma.sharedDirty, region.vma.anonymous);
        default: return 0;
    }
}

void rememberSharedAnonymous(RKLinuxTask& task) {
    task.sharedAnonymousBytes.clear();
    for (const RKLinuxRegion& region : task.snapshot->regions)
        if (const uint64_t shared = sharedAnonymousKB(region) * 1024)
            task.sharedAnonymousBytes.emplace_back(region.vma.start, shared);
}

// Loads a snapshot when none is held, or always when `fresh` (a walk starting over).
kern_return_t ensureSnapshot(RKLinuxPlatform& platform, RKLinuxTask& task, bool fresh) {
    if (task.snapshot && !fresh) return KERN_SUCCESS;
    RKRecycleWalkSnapshot(std::move(task.snapshot));
    return RKLoadWalkSnapshot(task, platform.procRoot(), platform.kernelPageSize(), task.snapshot);
}

}  // namespace

kern_return_t RKLinuxPlatform::regionRecurse(RKTask& task, uint64_t& address, uint64_t& size,
                                             RKRegionSubmapInfo& info, uint32_t& count) {
    RKLinuxTask* target = linuxTask(task);
    if (!target) return KERN_INVALID_ARGUMENT;
    const bool starting = address == 0;
    bool fresh = starting && !(target->snapshot && target->snapshot->readyForWalk);
    kern_return_t result = ensureSnapshot(*this, *target, fresh);
    if (result != KERN_SUCCESS) return result;
    // Whoever read it (this walk, or the image lister just before), the walk's snapshot is the
    // one the bound of unattributable shared pages comes from.
    if (starting) rememberSharedAnonymous(*target);
    target->snapshot->readyForWalk = false;
    const RKLinuxRegion* region = regionEndingAbove(*target->snapshot, address);
    if (!region) {
        result = target->snapshot->end;
        RKRecycleWalkSnapshot(std::move(target->snapshot));  // the walk is over
        return result;
    }
    address = region->vma.start;
    size = region->vma.end - region->vma.start;
    info = region->info;
    count = RK_REGION_SUBMAP_INFO_COUNT;
    return KERN_SUCCESS;
}

kern_return_t RKLinuxPlatform::region(RKTask& task, uint64_t& address, uint64_t& size, RKRegionBasicInfo& info) {
    RKLinuxTask* target = linuxTask(task);
    if (!target) return KERN_INVALID_ARGUMENT;
    kern_return_t result = ensureSnapshot(*this, *target, false);
    if (result != KERN_SUCCESS) return result;
    const RKLinuxRegion* region = regionEndingAbove(*target->snapshot, address);
    if (!region) return target->snapshot->end;
    // Linux has no nested maps: the top-level entry is the VMA itself.
    address = region->vma.start;
    size = region->vma.end - region->vma.start;
    info = RKRegionBasicInfo{};
    info.protection = region->info.protection;
    info.max_protection = region->info.max_protection;
    info.inheritance = region->info.inheritance;
    info.shared = region->info.share_mode == SM_SHARED ? 1 : 0;
    info.offset = region->info.offset;
    info.user_wired_count = region->info.user_wired_count;
    return KERN_SUCCESS;
}

kern_return_t RKLinuxPlatform::purgableState(RKTask&, uint64_t, int& state) {
    state = VM_PURGABLE_DENY;  // Linux has no purgeable memory.
    return KERN_SUCCESS;
}

std::optional<std::string> RKLinuxPlatform::regionFileName(RKTask& task, uint64_t address) {
    RKLinuxTask* target = linuxTask(task);
    if (!target || ensureSnapshot(*this, *target, false) != KERN_SUCCESS) return std::nullopt;
    const RKLinuxRegion* region = regionContaining(*target->snapshot, address);
    if (!region || region->detail.empty()) return std::nullopt;
    return std::string(region->detail);
}
