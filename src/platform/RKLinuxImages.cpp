// Loaded images on Linux: no symbol library is needed. A file is an image when the process maps
// it with execute permission, and every file mapping of it is one segment, named after what the
// mapping holds. The smaps read here is kept for the walk that follows, so images cost no
// second read.
#include <string_view>
#include <unordered_map>
#include <unordered_set>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTask.h"
#include "platform/RKLinuxWalk.h"

namespace {

constexpr uint8_t kSegmentText = 2;
constexpr uint8_t kSegmentData = 3;
constexpr uint8_t kSegmentLinkedit = 4;

// Executable code; read-only data the loader never wrote; data it relocated and then
// protected; writable data.
void nameSegment(const RKSmapsVma& vma, RKImageSegmentRecord& record) {
    if (vma.perms & RKSmapsExecute) {
        record.name = ".text";
        record.segment = kSegmentText;
    } else if (vma.perms & RKSmapsWrite) {
        record.name = ".data";
        record.segment = kSegmentData;
    } else if (vma.anonymous != 0) {
        record.name = ".data.rel.ro";
        record.segment = kSegmentData;
    } else {
        record.name = ".rodata";
        record.segment = kSegmentLinkedit;
    }
}

}  // namespace

kern_return_t RKLinuxPlatform::imageSegments(RKTask& task, std::vector<RKImageSegmentRecord>& segments) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    if (!target) return KERN_INVALID_ARGUMENT;
    RKRecycleWalkSnapshot(std::move(target->snapshot));
    kern_return_t result = RKLoadWalkSnapshot(*target, procRoot(), kernelPageSize(), target->snapshot);
    if (result != KERN_SUCCESS) return result;
    target->snapshot->readyForWalk = true;

    const auto& regions = target->snapshot->regions;
    std::unordered_set<std::string_view> images;
    for (const RKLinuxRegion& region : regions)
        if (region.kind == RKVmaKind::File && (region.vma.perms & RKSmapsExecute)) images.insert(region.vma.path);
    segments.clear();
    if (images.empty()) return KERN_SUCCESS;
    // The lowest mapping of a file is where the loader put it.
    std::unordered_map<std::string_view, uint64_t> bases;
    for (const RKLinuxRegion& region : regions) {
        if (region.kind != RKVmaKind::File || !images.count(region.vma.path)) continue;
        RKImageSegmentRecord record;
        record.path = std::string(region.detail.empty() ? region.vma.path : region.detail);
        record.baseAddress = bases.emplace(region.vma.path, region.vma.start).first->second;
        record.start = region.vma.start;
        record.size = region.vma.end - region.vma.start;
        nameSegment(region.vma, record);
        segments.push_back(std::move(record));
    }
    return KERN_SUCCESS;
}
