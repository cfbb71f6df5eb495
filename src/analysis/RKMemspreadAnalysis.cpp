// Object identity across processes, per-process memspread numbers and categories.
#include <algorithm>
#include <bit>

#include "analysis/RKMemspread.h"
#include "analysis/RKPointerSet.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxVmaClassifier.h"
#include "platform/RKWorkerPool.h"

namespace {

// Capacity hints: most objects are ordinary ones, a few dozen per process at least.
constexpr size_t kObjectsPerProcess = 100;
constexpr size_t kImageSegmentsPerProcess = 2;
constexpr size_t kTranslatedSharedCacheObjects = 512;

struct KeyedMap {
    uint64_t key;
    RKIdentityMap* map;
};

// A written shared-cache data page belongs to its process alone; clean ones are shared by every
// process whose shared cache lies at the same address.
uint64_t sharedCacheKey(const RKMemoryRegion& region, const RKProcess& process) {
    uint64_t key = region.start;
    bool written = region.dirtySize != 0 || region.swappedSize != 0;
    if (region.segment == RKSegmentData && written) {
        key ^= static_cast<uint64_t>(static_cast<uint32_t>(process.pid())) << 32;
    }
    return key;
}

KeyedMap identityOf(const RKMemoryRegion& region, const RKProcess& process, RKIdentityMaps& maps) {
    if (region.inSharedCache) {
        RKIdentityMap* map =
            process.isTranslated() ? &maps.sharedCacheTranslatedMemoryObjects : &maps.sharedCacheMemoryObjects;
        return {sharedCacheKey(region, process), map};
    }
    switch (region.segment) {
        case RKSegmentText: return {region.object_id, &maps.textMemoryObjects};
        case RKSegmentLinkedit: return {region.object_id, &maps.linkeditMemoryObjects};
        default: return {region.object_id, &maps.memoryObjects};
    }
}

// The private ids of one process, each with its object's index in the process's list: open
// addressing in one array sized for all the process's regions, as most of them have one.
class PrivateIdTable {
public:
    static constexpr uint32_t kNew = UINT32_MAX;

    explicit PrivateIdTable(size_t regions) : slots_(std::bit_ceil(std::max<size_t>(regions * 2, 16))) {}

    // The object index of `id` in `map`, or kNew after recording `next` for it.
    uint32_t findOrAdd(uint64_t id, const RKIdentityMap* map, uint32_t next) {
        const size_t mask = slots_.size() - 1;
        for (size_t at = static_cast<size_t>(id * 0x9E3779B97F4A7C15ull >> 20) & mask;; at = (at + 1) & mask) {
            Slot& slot = slots_[at];
            if (slot.id == 0) {
                slot = {id, map, next};
                return kNew;
            }
            if (slot.id == id && slot.map == map) return slot.object;
        }
    }

private:
    struct Slot {
        uint64_t id = 0;  // private ids are never 0
        const RKIdentityMap* map = nullptr;
        uint32_t object = 0;
    };
    std::vector<Slot> slots_;
};

// The category map entries of objects, made on first use. Objects met one after another mostly
// share their category (a process's regions of one kind): the last entry is kept, and the map
// is searched, with a key built, only when the name changes.
class CategoryFinder {
public:
    CategoryFinder(RKCategoryMap& categories, bool summarize) : categories_(categories), summarize_(summarize) {}

    RKMemoryCategory& operator()(const RKMemoryObject& object) {
        const std::string& name = object.name();
        const std::string& detail = summarize_ ? kNoDetail : object.detailedName();
        if (!last_ || name != lastName_ || detail != lastDetail_) {
            auto [it, inserted] = categories_.try_emplace(summarize_ ? name : object.fullName());
            if (inserted) it->second = std::make_shared<RKMemoryCategory>(summarize_);
            last_ = it->second.get();
            lastName_ = name, lastDetail_ = detail;
        }
        return *last_;
    }

private:
    static inline const std::string kNoDetail;
    RKCategoryMap& categories_;
    const bool summarize_;
    RKMemoryCategory* last_ = nullptr;
    std::string lastName_, lastDetail_;
};

}  // namespace

RKIdentityMaps::RKIdentityMaps(size_t processCount) {
    memoryObjects.reserve(kObjectsPerProcess * processCount);
    sharedCacheTranslatedMemoryObjects.reserve(kTranslatedSharedCacheObjects);
    textMemoryObjects.reserve(kImageSegmentsPerProcess * processCount);
    linkeditMemoryObjects.reserve(kImageSegmentsPerProcess * processCount);
}

void RKMemspread::analyzeData() {
    pidToMemspread_.clear();
    identityMaps_ = std::make_unique<RKIdentityMaps>(processes_.size());
    _attributeSharedAnonymousPages();
    _identifyPrivateObjects();
    for (size_t p = 0; p < processes_.size(); p++) _addProcess(p);
    for (RKMemoryObject* object : identityMaps_->ownedBySeveral) object->setOwnerPid(-1);
    finalizeObjects();
    _buildProcessToMemspreadMap();
}

// Private ids of a pid whose bits another process carries too (two snapshots of one process)
// may meet across processes: those processes find every object through the maps.
std::vector<bool> RKMemspread::_privateIdsAlone() const {
    std::vector<uint32_t> bits;
    bits.reserve(processes_.size());
    for (const auto& process : processes_) bits.push_back(RKPrivateObjectIdPidBits(process->pid()));
    std::vector<uint32_t> sorted = bits;
    std::sort(sorted.begin(), sorted.end());
    std::vector<bool> alone(processes_.size());
    for (size_t p = 0; p < bits.size(); p++) {
        auto [first, last] = std::equal_range(sorted.begin(), sorted.end(), bits[p]);
        alone[p] = last - first == 1;
    }
    return alone;
}

void RKMemspread::_identifyPrivateObjects() {
    RKIdentityMaps& maps = *identityMaps_;
    maps.byProcess.assign(processes_.size(), {});
    const std::vector<bool> alone = _privateIdsAlone();
    const bool breakDown = breakDownPhysMemspread();  // read once here: workers only read the cache
    // Each process's objects are its own: the processes are identified side by side.
    RKParallelApplyOnEveryCpu(processes_.size(), [&](size_t p) {
        const RKProcess& process = *processes_[p];
        if (!process.memoryRegions()) return;
        const RKRegionList& regions = *process.memoryRegions();
        RKProcessIdentity& own = maps.byProcess[p];
        PrivateIdTable table(alone[p] ? regions.size() : 0);
        for (uint32_t i = 0; i < regions.size(); i++) {
            const RKMemoryRegion& region = *regions[i];
            auto [key, map] = identityOf(region, process, maps);
            if (!alone[p] || region.inSharedCache || !RKIsPrivateObjectIdOf(key, process.pid())) {
                own.mappedRegions.push_back(i);
                continue;
            }
            uint32_t index = table.findOrAdd(key, map, static_cast<uint32_t>(own.privateObjects.size()));
            if (index == PrivateIdTable::kNew) {
                index = static_cast<uint32_t>(own.privateObjects.size());
                own.privateObjects.push_back(std::make_shared<RKMemoryObject>());
            }
            _addRegionToObject(own.privateObjects[index], regions[i], process, breakDown);
        }
        for (const auto& object : own.privateObjects) object->finalize();
    });
}

// Returns whether the object had another owner already.
bool RKMemspread::_addRegionToObject(const std::shared_ptr<RKMemoryObject>& object,
                                     const std::shared_ptr<RKMemoryRegion>& region, const RKProcess& process,
                                     bool breakDown) {
    if (isSharingAnalysisDisabled()) {
        object->addRegion(region, process.pageSize());
    } else {
        object->addRegion(region, process);
    }
    bool ownedBySeveral = false;
    if (breakDown && region->ownedExclusivelyByParentProcess) {
        ownedBySeveral = object->ownerPid() != -1 && object->ownerPid() != process.pid();
        object->setOwnerPid(process.pid());
    }
    region->setMemoryObject(object);
    return ownedBySeveral;
}

void RKMemspread::_addProcess(size_t index) {
    const RKProcess& process = *processes_[index];
    if (!process.memoryRegions()) return;  // not gathered (cancelled)
    const bool breakDown = breakDownPhysMemspread();
    RKIdentityMaps& maps = *identityMaps_;
    const RKRegionList& regions = *process.memoryRegions();
    for (uint32_t i : maps.byProcess[index].mappedRegions) {
        const std::shared_ptr<RKMemoryRegion>& region = regions[i];
        auto [key, map] = identityOf(*region, process, maps);
        std::shared_ptr<RKMemoryObject> object;
        if (key == RKNoIdentityKey || key == RKInvalidIdentityKey) {
            object = std::make_shared<RKMemoryObject>();
            maps.uniqueMemoryObjects.push_back(object);
        } else {
            auto& slot = (*map)[key];
            if (!slot) slot = std::make_shared<RKMemoryObject>();
            object = slot;
        }
        if (_addRegionToObject(object, region, process, breakDown)) maps.ownedBySeveral.insert(object.get());
    }
}

// The objects of the maps; private objects were finalized where they were made.
void RKMemspread::finalizeObjects() {
    if (!identityMaps_) return;
    RKIdentityMaps& maps = *identityMaps_;
    for (RKIdentityMap* map : {&maps.memoryObjects, &maps.sharedCacheMemoryObjects,
                               &maps.sharedCacheTranslatedMemoryObjects, &maps.textMemoryObjects,
                               &maps.linkeditMemoryObjects}) {
        for (auto& [key, object] : *map) object->finalize();
    }
    for (auto& object : maps.uniqueMemoryObjects) object->finalize();
}

RKProcessList RKMemspread::_notHiddenProcesses() const {
    RKProcessList shown;
    shown.reserve(processes_.size());
    for (const auto& process : processes_) {
        if (!process->hiddenFromDisplay()) shown.push_back(process);
    }
    return shown;
}

uint64_t RKMemspread::_calculateMemspreadForProcess(const RKProcess& process) const {
    if (!process.memoryRegions()) return 0;
    const RKRegionList& regions = *process.memoryRegions();
    uint64_t memspread = 0;
    if (breakDownPhysMemspread()) {
        for (const auto& region : regions) {
            // Memory another process owns is that process's, as the views show it.
            const RKMemoryObject* object = region->memoryObjectPointer();
            if (object && object->ownerPid() != -1 && object->ownerPid() != process.pid()) continue;
            memspread += region->dirtySize + region->swappedSize;
        }
        return memspread;
    }
    // Every process that maps an object is charged its whole dirty and swapped bytes, once.
    RKPointerSet counted;
    for (const auto& region : regions) {
        const RKMemoryObject* object = region->memoryObjectPointer();
        if (!object || !RKFirstMeeting(counted, *object)) continue;
        memspread += object->totalDirtySize() + object->totalSwappedSize();
    }
    return memspread;
}

void RKMemspread::_buildProcessToMemspreadMap() {
    pidToMemspread_.clear();
    std::vector<uint64_t> memspread(processes_.size());
    RKParallelApplyOnEveryCpu(processes_.size(), [&](size_t p) {
        if (!processes_[p]->hiddenFromDisplay()) memspread[p] = _calculateMemspreadForProcess(*processes_[p]);
    });
    pidToMemspread_.reserve(processes_.size());
    for (size_t p = 0; p < processes_.size(); p++) {
        if (!processes_[p]->hiddenFromDisplay()) pidToMemspread_[processes_[p]->pid()] = memspread[p];
    }
}

RKProcessList RKMemspread::_processesBySortingMemspread(const RKProcessList& processes) const {
    auto memspreadOf = [this](const RKProcess& process) {
        auto it = pidToMemspread_.find(process.pid());
        return it == pidToMemspread_.end() ? uint64_t{0} : it->second;
    };
    RKProcessList sorted = processes;
    std::sort(sorted.begin(), sorted.end(), [&](const auto& a, const auto& b) {
        uint64_t left = memspreadOf(*a), right = memspreadOf(*b);
        if (left != right) return left > right;
        return a->pid() > b->pid();
    });
    return sorted;
}

std::shared_ptr<RKCategoryMap> RKMemspread::_categoriesForObjects(const RKMemoryObjectList& objects,
                                                                  const RKProcess& process, uint8_t* processView,
                                                                  bool summarize) {
    auto categories = std::make_shared<RKCategoryMap>();
    CategoryFinder categoryFor(*categories, summarize);
    uint8_t state = RKProcessViewNone;
    for (const auto& object : objects) {
        std::shared_ptr<RKMemoryObject> view = object->viewForProcess(process);
        categoryFor(*object).addMemoryObject(view);
        if (state != RKProcessViewPresent && view != object) {
            state = RKProcessViewPresent;
        } else if (state == RKProcessViewNone && object->couldHaveProcessView()) {
            state = RKProcessViewPossible;
        }
    }
    if (processView) *processView = state;
    return categories;
}

RKCategoryMap RKMemspread::_categoriesForAllProcessesShouldSummarize(bool summarize) const {
    RKCategoryMap categories;
    CategoryFinder categoryFor(categories, summarize);
    RKPointerSet seen;
    for (const auto& process : processes_) {
        if (process->hiddenFromDisplay() || !process->memoryRegions()) continue;
        for (const auto& region : *process->memoryRegions()) {
            RKMemoryObject* object = region->memoryObjectPointer();
            if (!object || !RKFirstMeeting(seen, *object)) continue;
            categoryFor(*object).addMemoryObject(*object);
        }
    }
    return categories;
}

void RKMemspread::_totalForCategories(const RKCategoryMap& categories, RKMemoryTotal* outTotal) {
    RKMemoryTotal total;
    for (const auto& [key, category] : categories) {
        total.dirty += category->totalDirtySize();
        total.swapped += category->totalSwappedSize();
        total.clean += category->totalCleanSize();
        total.reclaimable += category->totalReclaimableSize();
        total.wired += category->totalWiredSize();
        total.regions += static_cast<uint32_t>(category->totalRegions());
    }
    *outTotal = total;
}
