// Builders for the model tests: processes that need no platform, and regions with sizes.
#pragma once

#include <array>
#include <memory>
#include <string>

#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"

inline constexpr uint64_t kPage = 4096;

inline std::shared_ptr<RKProcess> makeProcess(pid_t pid) {
    auto process = std::make_shared<RKProcess>();
    process->setPid(pid);
    process->setPageSize(kPage);
    return process;
}

struct RegionSizes {
    uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0;
};

// A shared mapping (eligible for per-process views) of [offset, offset + size) of object `id`.
inline std::shared_ptr<RKMemoryRegion> makeRegion(uint64_t id, uint64_t offset, uint64_t size, RegionSizes sizes = {},
                                                  const std::string& name = "shared") {
    auto region = std::make_shared<RKMemoryRegion>();
    region->object_id = id;
    region->offset = offset;
    region->start = 0x100000 + offset;
    region->size = size;
    region->share_mode = SM_SHARED;
    region->segment = RKSegmentNoImage;
    region->name = name;
    region->dirtySize = sizes.dirty;
    region->swappedSize = sizes.swapped;
    region->cleanNonSpecSize = sizes.clean;
    region->reclaimableSize = sizes.reclaimable;
    return region;
}

// dirty, swapped, clean, reclaimable, wired
inline std::array<uint64_t, 5> totalsOf(const RKMemoryObject& object) {
    return {object.totalDirtySize(), object.totalSwappedSize(), object.totalCleanSize(),
            object.totalReclaimableSize(), object.totalWiredSize()};
}

// A scripted platform whose owned-memory breakdown setting is `on`, for one scope.
class ScopedBreakdown {
public:
    explicit ScopedBreakdown(bool on) : scope_(platformWith(on)) { RKAnalysisSettings::resetCache(); }
    ~ScopedBreakdown() { RKAnalysisSettings::resetCache(); }

private:
    static std::shared_ptr<RKScriptedPlatform> platformWith(bool on) {
        auto platform = std::make_shared<RKScriptedPlatform>();
        platform->selfRegionValue = on ? 1 : 0;
        return platform;
    }
    RKScopedPlatform scope_;
};
