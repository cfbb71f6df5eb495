// Object identity across processes, per-process memspread numbers and categories.
#include <algorithm>

#include "analysis/RKMemspread.h"
#include "analysis/RKPointerSet.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"

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
    for (const auto& process : processes_) _addProcess(*process);
    for (RKMemoryObject* object : identityMaps_->ownedBySeveral) object->setOwnerPid(-1);
    finalizeObjects();
    _buildProcessToMemspreadMap();
}

void RKMemspread::_addProcess(const RKProcess& process) {
    if (!process.memoryRegions()) return;  // not gathered (cancelled)
    const bool breakDown = breakDownPhysMemspread();
    const bool sharingDisabled = isSharingAnalysisDisabled();
    RKIdentityMaps& maps = *identityMaps_;

    for (const auto& region : *process.memoryRegions()) {
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
        if (sharingDisabled) {
            object->addRegion(region, process.pageSize());
        } else {
            object->addRegion(region, process);
        }
        if (breakDown && region->ownedExclusivelyByParentProcess) {
            if (object->ownerPid() != -1 && object->ownerPid() != process.pid()) maps.ownedBySeveral.insert(object.get());
            object->setOwnerPid(process.pid());
        }
        region->setMemoryObject(object);
    }
}

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
            std::shared_ptr<RKMemoryObject> object = region->memoryObject();
            if (object && object->ownerPid() != -1 && object->ownerPid() != process.pid()) continue;
            memspread += region->dirtySize + region->swappedSize;
        }
        return memspread;
    }
    // Every process that maps an object is charged its whole dirty and swapped bytes, once.
    RKPointerSet counted(regions.size());
    for (const auto& region : regions) {
        std::shared_ptr<RKMemoryObject> object = region->memoryObject();
        if (!object || !counted.insert(object.get())) continue;
        memspread += object->totalDirtySize() + object->totalSwappedSize();
    }
    return memspread;
}

void RKMemspread::_buildProcessToMemspreadMap() {
    pidToMemspread_.clear();
    for (const auto& process : processes_) {
        if (process->hiddenFromDisplay()) continue;
        pidToMemspread_[process->pid()] = _calculateMemspreadForProcess(*process);
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
            std::shared_ptr<RKMemoryObject> object = region->memoryObject();
            if (!object || !seen.insert(object.get())) continue;
            categoryFor(*object).addMemoryObject(object);
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
