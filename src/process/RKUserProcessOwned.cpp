// Memory a process owns, mapped or not: the owned-object list, the charge of a region that maps
// an owned object, regions without an address for the objects no region maps, and the
// reduction of the kernel's owned-memory pseudo-region by what was found mapped.
#include <atomic>
#include <cerrno>
#include <cstdio>

#include "model/RKMemoryRegion.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint32_t kNoMemspreadFlag = 0x1;
// Regions of this tag are never charged as owned without a list.
constexpr uint32_t kUntrackedOwnedTag = 87;

uint32_t ledgerTagOf(const RKOwnedVmObjectRecord& record) { return (record.flags >> 1) & 0x7; }
int purgeStateOf(const RKOwnedVmObjectRecord& record) { return static_cast<int>((record.flags >> 4) & 0x3); }

// The dirty and swapped bytes a record charges its owner.
void ownedSizes(const RKOwnedVmObjectRecord& record, uint64_t& dirty, uint64_t& swapped) {
    dirty = swapped = 0;
    if (record.flags & kNoMemspreadFlag) return;
    int state = purgeStateOf(record);
    if (state == VM_PURGABLE_NONVOLATILE || state == VM_PURGABLE_DENY) {
        dirty = record.resident_size > record.reusable_size ? record.resident_size - record.reusable_size : 0;
        swapped = record.compressed_size;
    } else {
        dirty = record.wired_size;  // volatile or empty: only what is wired stays
    }
}

std::string withLedgerName(const std::string& name, const RKOwnedVmObjectRecord& record) {
    auto ledger = RKMemoryRegion::vmLedgerNameForTag(ledgerTagOf(record));
    return ledger ? name + " (" + *ledger + ")" : name;
}

}  // namespace

std::optional<RKOwnedVmObjectMap> RKUserProcess::_gatherOwnedVmObjects() {
    if (!breakDownPhysMemspread() || !task_) return std::nullopt;
    std::vector<RKOwnedVmObjectRecord> records;
    int error = RKPlatform::current().ownedVmObjects(*task_, records);
    if (error == ENOENT || error == ESRCH) return std::nullopt;  // no such list; or gone, as the walk will say
    if (error == EACCES || error == EPERM) {
        static std::atomic<bool> said{false};
        if (!said.exchange(true))
            std::fprintf(stderr, "Descriptors of another user's process can be read only by root: memory such a "
                                 "process holds without mapping it is not counted\n");
        warnings_.push_back(displayString() +
                            ": descriptors cannot be read without root - memory held through them is not counted");
        return std::nullopt;
    }
    if (error != 0) {
        errno = error;
        _addErrnoWarningWithDescription("vm.get_owned_vmobjects");
        return std::nullopt;
    }
    RKOwnedVmObjectMap map;
    for (auto& record : records) map.emplace(record.object_id, std::move(record));
    return map;
}

void RKUserProcess::_chargeOwnedObjectForRegion(RKMemoryRegion& region, const RKRegionSubmapInfo& info,
                                                int purgeState, RKRegionWalkState& state) {
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    auto owned = ownedVmObjects_ ? ownedVmObjects_->find(region.object_id) : RKOwnedVmObjectMap::iterator{};
    if (ownedVmObjects_ && owned != ownedVmObjects_->end()) {
        const RKOwnedVmObjectRecord& record = owned->second;
        ownedSizes(record, dirty, swapped);
        region.reclaimableSize = record.reusable_size;
        region.name = withLedgerName(region.name, record);
        state.chargedOwnedObjects.insert(region.object_id);
        ownedVmObjects_->erase(owned);
    } else if (ownedVmObjects_ && state.chargedOwnedObjects.count(region.object_id)) {
        // Another mapping of an object that a region already carries whole.
    } else if (!ownedVmObjects_ && purgeState != VM_PURGABLE_DENY && region.user_tag != kUntrackedOwnedTag &&
               info.pages_resident != 0) {
        dirty = region.dirtySize + region.cleanNonSpecSize;
    } else {
        return;
    }
    region.ownedExclusivelyByParentProcess = true;
    state.mappedOwnedTotal += dirty + swapped;
    region.dirtySize = dirty;
    region.cleanNonSpecSize = 0;
    region.swappedSize = swapped;
}

void RKUserProcess::_addUnconsumedOwnedObjectRegions(RKRegionWalkState& state) {
    if (!ownedVmObjects_) return;
    const std::string unmappedName = RKMemoryRegion::categoryNameForTag(RK_OWNED_MEMORY_TAG);
    for (const auto& [id, record] : *ownedVmObjects_) {
        auto region = state.regionBlocks.make();
        region->object_id = id;
        region->ownedExclusivelyByParentProcess = true;
        region->user_tag = RK_OWNED_MEMORY_TAG;
        region->name = withLedgerName(unmappedName, record);
        region->detailedName = record.detail;
        region->size = record.virtual_size;
        region->reclaimableSize = record.reusable_size;
        region->start = RKRegionNoAddress;
        region->share_mode = SM_SHARED;
        ownedSizes(record, region->dirtySize, region->swappedSize);
        region->wired = record.wired_size != 0;
        state.regions.push_back(std::move(region));
    }
}

void RKUserProcess::_reconcileUnmappedOwnedRegion(RKRegionWalkState& state) {
    auto& unmapped = state.unmappedOwnedRegion;
    if (!unmapped) return;
    uint64_t excess = state.mappedOwnedTotal;
    if (unmapped->dirtySize < excess) {
        excess -= unmapped->dirtySize;
        unmapped->dirtySize = 0;
        if (unmapped->swappedSize >= excess) {
            unmapped->swappedSize -= excess;
        } else {
            excess -= unmapped->swappedSize;
            warnings_.push_back(displayString() +
                                ": Memspread changed while analyzing – unmapped owned physical memspread may be "
                                "over-counted by " +
                                std::to_string(excess) + " bytes");
            unmapped->swappedSize = 0;
        }
    } else {
        unmapped->dirtySize -= excess;
    }
    if (unmapped->dirtySize + unmapped->swappedSize != 0) {
        unmapped->start = RKRegionNoAddress;
        state.regions.push_back(unmapped);
    } else {
        unmapped->freeSubrangeList();  // the region stays in its block until the block goes
    }
    unmapped.reset();
}

std::vector<std::string> RKUserProcess::unheldSharedMemoryWarnings() {
    std::vector<std::string> warnings;
    std::vector<RKSysVSegment> segments;
    RKPlatform& platform = RKPlatform::current();
    if (platform.sysVSegments(segments) != 0) return warnings;
    for (const RKSysVSegment& segment : segments) {
        uint32_t status = 0;
        if (segment.attached != 0 || platform.shortBsdInfoStatus(segment.creator, status) != ESRCH) continue;
        warnings.push_back("SysV shared memory segment " + std::to_string(segment.shmid) + " holds " +
                           std::to_string(segment.resident + segment.swapped) +
                           " bytes that no process maps: its creator [" + std::to_string(segment.creator) +
                           "] is gone");
    }
    return warnings;
}
