// The loaded images of a live user process, and the naming of regions after them.
#include <algorithm>
#include <string_view>

#include "model/RKMemoryRegion.h"
#include "process/RKImage.h"
#include "process/RKUserProcess.h"

namespace {

// The part of a segment name before its first space; the header counts as text.
std::string_view segmentNameOf(std::string_view name) {
    if (name == "MACH_HEADER") return "__TEXT";
    return name.substr(0, name.find(' '));
}

}  // namespace

void RKUserProcess::_gatherImageData() {
    if (!task_ || !images_) return;
    std::vector<RKImageSegmentRecord> segments;
    if (RKPlatform::current().imageSegments(*task_, segments) != KERN_SUCCESS) return;  // the walk reports it
    const uint64_t sharedEnd = sharedRegionBase_ + sharedRegionSize_;
    RKImageList& images = *images_;
    images.reserve(images.size() + segments.size());
    // Segments of one image arrive together: resolve its owner path once.
    const RKImageSegmentRecord* owner = nullptr;
    RKSharedString ownerPath;
    for (const RKImageSegmentRecord& record : segments) {
        if (!owner || owner->path != record.path || owner->baseAddress != record.baseAddress) {
            owner = &record;
            bool inSharedRegion = record.baseAddress >= sharedRegionBase_ && record.baseAddress < sharedEnd;
            // Outside the shared region the path is the kernel's own, already free of links.
            ownerPath = inSharedRegion ? pathInternCache().intern(record.path, RKPathInternSlotForBase(record.baseAddress),
                                                                  RKPathInternProbes, RKPathInternLimit)
                                       : RKUnsharedString(record.path);
        }
        std::string_view name = segmentNameOf(record.name);
        auto image = std::make_shared<RKImage>();
        image->start = record.start;
        image->size = record.size;
        image->setName(name.empty() ? RKUnsharedString("unknown")
                                    : segmentNameInternCache().intern(name, 0, RKSegmentNameInternSlots,
                                                                      RKSegmentNameInternLimit));
        // Names that are not "__" names leave the code to the platform that knows it.
        if (record.segment != RKSegmentUnset) image->segment = record.segment;
        image->setOwnerPath(ownerPath);
        images.push_back(std::move(image));
    }
    std::stable_sort(images.begin(), images.end(),
                     [](const auto& a, const auto& b) { return a->start < b->start; });
}

bool RKUserProcess::_nameRegionFromImages(RKMemoryRegion& region, RKRegionWalkState& state) {
    if (!state.imageEnumerator) return false;
    auto image = state.imageEnumerator->nextImageForStart(region.start, region.end());
    if (!image) return false;
    region.name = image->name();
    region.detailedName = image->ownerPath();
    region.segment = image->segment;
    return true;
}
