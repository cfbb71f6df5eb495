#include "model/RKMemoryCategory.h"

#include "model/RKMemoryObject.h"

void RKMemoryCategory::addMemoryObject(const std::shared_ptr<RKMemoryObject>& object) {
    if (!firstMemoryObject_) firstMemoryObject_ = object;
    addMemoryObject(*object);
}

void RKMemoryCategory::addMemoryObject(RKMemoryObject& object) {
    if (!firstMemoryObject_) firstMemoryObject_ = object.shared_from_this();
    totalDirtySize_ += object.totalDirtySize();
    totalSwappedSize_ += object.totalSwappedSize();
    totalCleanSize_ += object.totalCleanSize();
    totalReclaimableSize_ += object.totalReclaimableSize();
    totalWiredSize_ += object.totalWiredSize();
    totalRegions_ += static_cast<int32_t>(object.memoryRegions().size());
}

std::string RKMemoryCategory::name() const { return firstMemoryObject_ ? firstMemoryObject_->name() : std::string(); }

std::string RKMemoryCategory::detailedName() const {
    if (isSummary_ || !firstMemoryObject_) return std::string();
    return firstMemoryObject_->detailedName();
}

std::string RKMemoryCategory::fullName() const {
    if (isSummary_ || !firstMemoryObject_) return name();
    return firstMemoryObject_->fullName();
}

bool RKMemoryCategory::verbose() const { return firstMemoryObject_ && firstMemoryObject_->verbose(); }
