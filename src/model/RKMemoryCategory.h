// One row of a report: the sum of the memory objects (or per-process views of them) that share
// one display name. The first object added names the category.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "model/RKCategoryMap.h"

class RKMemoryObject;

class RKMemoryCategory {
public:
    // isSummary: made for summarized output, where a category is named by its short name only.
    explicit RKMemoryCategory(bool isSummary = false) : isSummary_(isSummary) {}

    // Adds the object's five totals and its number of regions; the first object names the
    // category. A view built from one process's regions counts only those regions.
    void addMemoryObject(const std::shared_ptr<RKMemoryObject>& object);
    // The same for an object the caller holds no reference to: only the first is taken one of.
    void addMemoryObject(RKMemoryObject& object);

    bool isSummary() const { return isSummary_; }
    // Names of the first object; empty when nothing was added. A summary has no detail.
    std::string name() const;
    std::string detailedName() const;
    std::string fullName() const;
    bool verbose() const;  // printed only in verbose output

    int32_t totalRegions() const { return totalRegions_; }
    uint64_t totalDirtySize() const { return totalDirtySize_; }
    uint64_t totalSwappedSize() const { return totalSwappedSize_; }
    uint64_t totalCleanSize() const { return totalCleanSize_; }
    uint64_t totalReclaimableSize() const { return totalReclaimableSize_; }
    uint64_t totalWiredSize() const { return totalWiredSize_; }
    const std::shared_ptr<RKMemoryObject>& firstMemoryObject() const { return firstMemoryObject_; }

    void setTotalRegions(int32_t value) { totalRegions_ = value; }
    void setTotalDirtySize(uint64_t value) { totalDirtySize_ = value; }
    void setTotalSwappedSize(uint64_t value) { totalSwappedSize_ = value; }
    void setTotalCleanSize(uint64_t value) { totalCleanSize_ = value; }
    void setTotalReclaimableSize(uint64_t value) { totalReclaimableSize_ = value; }
    void setTotalWiredSize(uint64_t value) { totalWiredSize_ = value; }
    void setFirstMemoryObject(std::shared_ptr<RKMemoryObject> object) { firstMemoryObject_ = std::move(object); }

private:
    bool isSummary_ = false;
    int32_t totalRegions_ = 0;
    uint64_t totalDirtySize_ = 0;
    uint64_t totalSwappedSize_ = 0;
    uint64_t totalCleanSize_ = 0;
    uint64_t totalReclaimableSize_ = 0;
    uint64_t totalWiredSize_ = 0;
    std::shared_ptr<RKMemoryObject> firstMemoryObject_;
};
