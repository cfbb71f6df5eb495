#include "model/RKMemoryRegion.h"

#include "model/RKAssert.h"
#include "model/RKMemoryObject.h"
#include "model/RKRangeList.h"
#include "platform/RKKernelTypes.h"

// One per mapping: a field added in the wrong place costs a padding hole per mapping.
static_assert(sizeof(void*) != 8 || sizeof(RKMemoryRegion) <= 104);

RKMemoryRegion::RKMemoryRegion() = default;
RKMemoryRegion::~RKMemoryRegion() = default;

std::shared_ptr<RKMemoryObject> RKMemoryRegion::memoryObject() const {
    return memoryObject_ ? memoryObject_->weak_from_this().lock() : nullptr;
}

std::string RKMemoryRegion::fullName() const {
    if (detailedName.empty()) return name;
    std::string joined;
    joined.reserve(name.size() + 1 + detailedName.size());
    joined.append(name).append(1, ' ').append(detailedName);
    return joined;
}

bool RKMemoryRegion::eligibleForProcessView() const {
    if (isFake() || inSharedCache) return false;
    if (share_mode == SM_PRIVATE || share_mode == SM_EMPTY || share_mode == SM_PRIVATE_ALIASED) return false;
    return segment != RKSegmentText && segment != RKSegmentData && segment != RKSegmentLinkedit;
}

bool RKMemoryRegion::eligibleForSubrangesUsingPageSize(uint64_t pageSize) const {
    if (!eligibleForProcessView() || size <= pageSize || ownedExclusivelyByParentProcess) return false;
    const uint64_t states[] = {dirtySize, swappedSize, cleanNonSpecSize, reclaimableSize};
    bool anyState = false;
    for (uint64_t state : states) {
        if (state == size) return false;  // wholly in one state: nothing to split
        anyState = anyState || state != 0;
    }
    return anyState;
}

void RKMemoryRegion::setEnd(uint64_t newEnd) {
    RKAssert(newEnd >= start, "RKMemoryRegion", "end >= self.start");
    size = newEnd - start;
}

int RKMemoryRegion::compare(const RKMemoryRegion& other) const {
    if (start != other.start) return start < other.start ? -1 : 1;
    if (size != other.size) return size > other.size ? -1 : 1;
    return 0;
}

void RKMemoryRegion::addSubrange(uint64_t location, uint64_t length, const RKMemoryTotal& total,
                                 uint64_t pageSize) {
    if (!subrangeList_) subrangeList_ = std::make_unique<RKRangeList>();
    subrangeList_->addRange(location, length, pageSize, total);
}

void RKMemoryRegion::freeSubrangeList() { subrangeList_.reset(); }
