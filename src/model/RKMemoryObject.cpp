#include "model/RKMemoryObject.h"

#include <algorithm>
#include <span>

#include "model/RKAssert.h"
#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"

namespace {

const std::string kNoName;

}  // namespace

// Nearly one per mapping: see RKMemoryRegion.cpp.
static_assert(sizeof(void*) != 8 || sizeof(RKMemoryObject) <= 104);

RKMemoryObject::RKMemoryObject() = default;

RKRangeList* RKMemoryObject::_rangeList() const {
    const RKObjectRegions::Extras* extras = memoryRegions_.extras();
    return extras ? extras->rangeList.get() : nullptr;
}

RKProcessRegionMap* RKMemoryObject::_processRegions() const {
    const RKObjectRegions::Extras* extras = memoryRegions_.extras();
    return extras ? extras->processRegions.get() : nullptr;
}

RKObjectRegions::Extras& RKMemoryObject::_extras() {
    RKObjectRegions::Extras* extras = memoryRegions_.extras();
    RKAssert(extras != nullptr, "RKMemoryObject", "range list or process views with fewer than two regions");
    return *extras;
}

RKMemoryObject::~RKMemoryObject() {
    // A view or a copy shares regions that point elsewhere; forgetting checks.
    for (const auto& region : memoryRegions_) region->forgetMemoryObject(this);
}

void RKMemoryObject::addRegion(const std::shared_ptr<RKMemoryRegion>& region, const RKProcess& process) {
    _addRegion(region, process.pageSize(), &process);
}

void RKMemoryObject::addRegion(const std::shared_ptr<RKMemoryRegion>& region, uint64_t pageSize) {
    _addRegion(region, pageSize, nullptr);
}

void RKMemoryObject::_addRegion(const std::shared_ptr<RKMemoryRegion>& region, uint64_t pageSize,
                                const RKProcess* process) {
    RKAssert(!accurateSizes_, "RKMemoryObject", "region added to a finalized memory object");
    memoryRegions_.push_back(region);
    containsFakeRegion_ = containsFakeRegion_ || region->isFake();
    // Listed (and counted as a region), but there is no VM object whose pages it could add.
    if (region->object_id == 0) return;

    if (process) _addToProcessViews(region, process->pid());
    // Most objects have one region: its range list is built only when a second one comes, or
    // for a moment when the object is finalized.
    RKRangeList* rangeList = _rangeList();
    if (!rangeList && soleRegion_ == kNone) {
        RKAssert(pageSize <= UINT32_MAX, "RKMemoryObject", "page size within 32 bits");
        soleRegion_ = static_cast<uint32_t>(memoryRegions_.size() - 1);
        soleRegionPageSize_ = static_cast<uint32_t>(pageSize);
        return;
    }
    if (!rangeList) {
        std::unique_ptr<RKRangeList>& made = _extras().rangeList;
        made = std::make_unique<RKRangeList>();
        rangeList = made.get();
        _mergeSoleRegion(*rangeList);
    }
    rangeList->addRegion(*region, pageSize);
    region->freeSubrangeList();
}

// Once the views begin (at the first eligible region) they take every region with pages of
// every process, eligible or not. While one process alone has regions there, no map is made:
// they are the regions from `viewsFrom_` on.
void RKMemoryObject::_addToProcessViews(const std::shared_ptr<RKMemoryRegion>& region, pid_t pid) {
    if (viewsFrom_ == kNone) {
        if (!region->eligibleForProcessView()) return;
        viewsFrom_ = static_cast<uint32_t>(memoryRegions_.size() - 1);
        viewsPid_ = pid;
        return;
    }
    RKProcessRegionMap* views = _processRegions();
    if (!views) {
        if (pid == viewsPid_) return;
        std::unique_ptr<RKProcessRegionMap>& made = _extras().processRegions;
        made = std::make_unique<RKProcessRegionMap>();
        views = made.get();
        RKRegionList& first = (*views)[viewsPid_];
        for (size_t i = viewsFrom_; i + 1 < memoryRegions_.size(); i++)
            if (memoryRegions_[i]->object_id != 0) first.push_back(memoryRegions_[i]);
    }
    (*views)[pid].push_back(region);
}

void RKMemoryObject::_mergeSoleRegion(RKRangeList& into) {
    RKMemoryRegion& sole = *memoryRegions_[soleRegion_];
    into.addRegion(sole, soleRegionPageSize_);
    sole.freeSubrangeList();
    soleRegion_ = kNone;
}

void RKMemoryObject::finalizeUsingRegionDirtySize(bool useRegionDirtySize) {
    RKAssert(!accurateSizes_, "RKMemoryObject", "memory object finalized twice");
    RKMemoryTotal merged{};
    if (soleRegion_ != kNone) {
        RKRangeList sole;
        _mergeSoleRegion(sole);
        merged = sole.sum();
    } else if (const RKRangeList* rangeList = _rangeList()) {
        merged = rangeList->sum();
    }

    if (useRegionDirtySize) {
        totalDirtySize_ = 0;
        totalSwappedSize_ = 0;
        for (const auto& region : memoryRegions_) {
            totalDirtySize_ += region->dirtySize;
            totalSwappedSize_ += region->swappedSize;
        }
    } else {
        totalDirtySize_ = merged.dirty;
        totalSwappedSize_ = merged.swapped;
        if (viewsFrom_ != kNone && RKAnalysisSettings::breakDownPhysMemspread()) _raiseToProcessSums();
    }
    totalCleanSize_ = merged.clean;
    totalReclaimableSize_ = merged.reclaimable;
    totalWiredSize_ = merged.wired;
    if (RKObjectRegions::Extras* extras = memoryRegions_.extras()) {
        extras->rangeList.reset();
        if (extras->processRegions && !_keepsProcessViews()) extras->processRegions.reset();
    }
    viewsFrom_ = kNone;
    if (containsFakeRegion_) _nameFakeRegions();
    accurateSizes_ = true;
}

// Merging by offset can report less than one process's own regions do (a process's owned
// memory is charged in full to its regions); the object never shows less than any one process.
void RKMemoryObject::_raiseToProcessSums() {
    auto raise = [this](auto&& regions) {
        uint64_t dirty = 0, swapped = 0;
        for (const auto& region : regions) {
            if (region->object_id == 0) continue;
            dirty += region->dirtySize;
            swapped += region->swappedSize;
        }
        totalDirtySize_ = std::max(totalDirtySize_, dirty);
        totalSwappedSize_ = std::max(totalSwappedSize_, swapped);
    };
    const RKProcessRegionMap* views = _processRegions();
    if (!views) {
        raise(std::span(memoryRegions_).subspan(viewsFrom_));
        return;
    }
    for (const auto& [pid, regions] : *views) raise(regions);
}

// Views can differ only when two or more processes map the object and at least one of them
// does not see it whole through a single region.
bool RKMemoryObject::_keepsProcessViews() const {
    const RKProcessRegionMap& views = *_processRegions();
    if (views.size() < 2) return false;
    for (const auto& [pid, regions] : views) {
        if (regions.size() != 1) return true;
        const RKMemoryRegion& region = *regions.front();
        bool seesWhole = region.dirtySize == totalDirtySize_ && region.swappedSize == totalSwappedSize_ &&
                         region.cleanNonSpecSize == totalCleanSize_ &&
                         region.reclaimableSize == totalReclaimableSize_ && region.wiredSize() == totalWiredSize_;
        if (!seesWhole) return true;
    }
    return false;
}

// Owned but unmapped memory takes the name of a mapping of the same object.
void RKMemoryObject::_nameFakeRegions() {
    const RKMemoryRegion* canonical = _canonicalRegion();
    if (!canonical || canonical->isFake()) return;
    for (const auto& region : memoryRegions_) {
        if (!region->isFake()) continue;
        region->name = canonical->name;
        region->detailedName = canonical->detailedName;
    }
}

std::shared_ptr<RKMemoryObject> RKMemoryObject::copy() const {
    RKAssert(accurateSizes_ && !_rangeList(), "RKMemoryObject", "copy of a memory object that is not finalized");
    auto copied = std::make_shared<RKMemoryObject>();
    copied->totalDirtySize_ = totalDirtySize_;
    copied->totalSwappedSize_ = totalSwappedSize_;
    copied->totalCleanSize_ = totalCleanSize_;
    copied->totalWiredSize_ = totalWiredSize_;
    copied->accurateSizes_ = accurateSizes_;
    copied->ownerPid_ = ownerPid_;
    copied->memoryRegions_ = memoryRegions_;
    copied->containsFakeRegion_ = containsFakeRegion_;
    return copied;
}

std::shared_ptr<RKMemoryObject> RKMemoryObject::viewForProcess(const RKProcess& process) {
    std::shared_ptr<RKMemoryObject> view = shared_from_this();
    if (const RKProcessRegionMap* views = _processRegions(); views && !views->empty()) {
        auto own = views->find(process.pid());
        if (own == views->end()) return view;  // whole, whoever owns it
        view = std::make_shared<RKMemoryObject>();
        view->ownerPid_ = ownerPid_;
        for (const auto& region : own->second) view->addRegion(region, process.pageSize());
        view->finalizeUsingRegionDirtySize(process.breakDownPhysMemspread());
    }
    if (ownerPid_ != -1 && ownerPid_ != process.pid()) {
        // Memory owned by another process costs this one nothing dirty or swapped.
        auto charged = view->copy();
        charged->totalDirtySize_ = 0;
        charged->totalSwappedSize_ = 0;
        charged->totalCleanSize_ = view->totalCleanSize_ + totalDirtySize_ + totalSwappedSize_;
        view = charged;
    }
    return view;
}

const RKMemoryRegion* RKMemoryObject::_canonicalRegion() const {
    if (memoryRegions_.empty()) return nullptr;
    const RKMemoryRegion* first = memoryRegions_.front().get();
    if (!first->inSharedCache && ownerPid_ == -1) return first;
    for (const auto& region : memoryRegions_) {
        bool qualifies = first->inSharedCache ? !region->unusedSharedCacheRegion : !region->isFake();
        if (qualifies) return region.get();
    }
    return first;
}

const std::string& RKMemoryObject::name() const {
    const RKMemoryRegion* canonical = _canonicalRegion();
    return canonical ? canonical->name.str() : kNoName;
}

const std::string& RKMemoryObject::detailedName() const {
    const RKMemoryRegion* canonical = _canonicalRegion();
    return canonical ? canonical->detailedName.str() : kNoName;
}

std::string RKMemoryObject::fullName() const {
    const RKMemoryRegion* canonical = _canonicalRegion();
    return canonical ? canonical->fullName() : std::string();
}

bool RKMemoryObject::verbose() const { return !memoryRegions_.empty() && memoryRegions_.front()->verbose; }

bool RKMemoryObject::couldHaveProcessView() const {
    const RKProcessRegionMap* views = _processRegions();
    return (views && !views->empty()) || ownerPid_ != -1;
}
