// One segment of one loaded image, and the forward-only cursor that the walk uses to find the
// image segment of each region in ascending address order.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "model/RKMemoryRegion.h"
#include "process/RKStringInternTable.h"

class RKImage {
public:
    uint8_t segment = RKSegmentUnset;  // set by setName
    uint64_t start = 0;
    uint64_t size = 0;
    uint64_t end() const { return start + size; }

    const std::string& name() const { return *name_; }
    const std::string& ownerPath() const { return *ownerPath_; }
    // Stores the name and derives the segment from its prefix: "__TEXT" and "__OBJC_RO" text,
    // "__LINKEDIT" link-edit, any other "__" name data; other names leave the segment as it was.
    void setName(RKSharedString name);
    void setOwnerPath(RKSharedString path) { ownerPath_ = std::move(path); }

private:
    RKSharedString name_ = RKUnsharedString("");
    RKSharedString ownerPath_ = RKUnsharedString("");
};

using RKImageList = std::vector<std::shared_ptr<RKImage>>;

class RKImageEnumerator {
public:
    // Keeps a reference to the list, not a copy, so images appended later are seen.
    explicit RKImageEnumerator(const RKImageList& images) : images_(images) {}

    // The first image at or after the cursor that overlaps [start, end) (or lies inside
    // [start, end]); images wholly before `start` are passed for good. The cursor stays on a
    // returned image, so the next range that overlaps it finds it again.
    std::shared_ptr<RKImage> nextImageForStart(uint64_t start, uint64_t end);

private:
    const RKImageList& images_;
    size_t index_ = 0;
};
