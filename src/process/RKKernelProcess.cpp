#include "process/RKKernelProcess.h"

#include <algorithm>
#include <cstdio>

#include "model/RKAuxData.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxKernelKinds.h"
#include "platform/RKPlatform.h"

namespace {

// Identity of kernel memory: unique in a run, clear of user processes' object ids (top bit)
// and private ids (bit 62).
constexpr uint64_t kSiteObjectBase = 0x100000000ull;
constexpr uint64_t kZoneObjectBase = 0x200000000ull;
// A counter is the counter type without the wired or zone bit.
constexpr uint64_t kCounterMask = 0x9FF;

std::string format(const char* pattern, auto... values) {
    char text[128];
    int length = std::snprintf(text, sizeof text, pattern, values...);
    if (length < 0) return {};
    return std::string(text, std::min(static_cast<size_t>(length), sizeof text - 1));
}

std::string fixedName(const char (&name)[RK_ZONE_NAME_MAX]) {
    size_t length = 0;
    while (length < RK_ZONE_NAME_MAX && name[length] != '\0') ++length;
    return std::string(name, length);
}

std::string nameByType(const RKMemoryInfoRecord& site, const RKKernelProcess::RKKextTags& kexts) {
    const unsigned long long value = site.site;
    switch (site.flags & VM_KERN_SITE_TYPE) {
        case VM_KERN_SITE_TAG: {
            std::string_view name = RKLinuxKernelTagName(site.site);
            return name.empty() ? format("VM_KERN_MEMORY_%llu", value) : std::string(name);
        }
        case VM_KERN_SITE_KMOD: {
            auto kext = kexts.find(site.site);
            return kext != kexts.end() ? kext->second : format("unloaded kmod %llu", value);
        }
        case VM_KERN_SITE_KERNEL:
            // Linux names its kernel sites (vmalloc callers) in the record; an unnamed one has
            // no symbol to look up.
            return format("site 0x%llx", value);
        case VM_KERN_SITE_COUNTER: {
            std::string_view name = RKLinuxKernelCounterName(site.site);
            return name.empty() ? format("VM_KERN_COUNT_%llu", value) : std::string(name);
        }
        default:
            return format("unknown site (0x%x, 0x%llx)", static_cast<unsigned>(site.flags & VM_KERN_SITE_TYPE),
                          value);
    }
}

}  // namespace

bool RKKernelProcess::initWithBsdInfo(const RKBsdInfo& info) {
    if (!RKProcess::initWithBsdInfo(info)) return false;
    setIdleExitStatus(1);
    counters_ = std::make_shared<RKAuxDataMap>();
    return true;
}

void RKKernelProcess::gatherData() {
    if (memoryRegions()) return;
    if (!counters_) counters_ = std::make_shared<RKAuxDataMap>();
    RKKernelMemoryInfo info;
    kern_return_t result = RKPlatform::current().memoryInfo(info);
    if (result != KERN_SUCCESS) {
        const char* text = mach_error_string(result);
        std::fprintf(stderr, "%s: mach_memory_info: %s\n", displayString().c_str(), text);
        errors_.push_back(displayString() + ": " + text);
        return;
    }
    RKRegionList regions;
    regions.reserve(info.zoneNames.size() + info.sites.size());
    // Zone i is described by name i and record i; a record count that falls short ends the list.
    for (size_t i = 0; i < info.zoneNames.size() && i < info.zones.size(); ++i) {
        const RKZoneInfo& zone = info.zones[i];
        auto region = std::make_shared<RKMemoryRegion>();
        region->name = fixedName(info.zoneNames[i].mzn_name);
        if (region->name.empty()) region->name = "unknown";
        if (zone.mzi_collectable != 0) {
            // Elements in use are the zone's dirty memory; the rest the kernel can give back.
            const uint64_t used = zone.mzi_count * zone.mzi_elem_size;
            region->dirtySize = std::min(used, zone.mzi_cur_size);
            region->reclaimableSize = zone.mzi_cur_size - region->dirtySize;
        } else {
            region->dirtySize = zone.mzi_cur_size;
        }
        region->size = zone.mzi_cur_size;
        region->start = RKRegionNoAddress;
        region->share_mode = SM_PRIVATE;
        region->object_id = i | kZoneObjectBase;
        regions.push_back(std::move(region));
    }
    _addWiredData(info.sites, info.zoneNames, info.modules, regions);
    if (info.restricted) {
        warnings_.push_back(displayString() +
                            ": slab caches and vmalloc callers need root; only /proc/meminfo's figures are shown");
    }
    setMemoryRegions(std::move(regions));
}

void RKKernelProcess::_addWiredData(const std::vector<RKMemoryInfoRecord>& sites,
                                    const std::vector<RKZoneName>& zoneNames, const RKKextTags& kexts,
                                    RKRegionList& regions) {
    for (size_t i = 0; i < sites.size(); ++i) {
        const RKMemoryInfoRecord& site = sites[i];
        const bool isCounter = (site.flags & kCounterMask) == VM_KERN_SITE_COUNTER;
        const uint64_t value = isCounter ? site.mapped : site.size;
        if (site.site == 0 && value == 0) continue;
        if (isCounter) {
            counters_->setObject(_nameForWiredInfo(site, kexts, nullptr),
                                 std::make_shared<RKAuxData>(static_cast<int64_t>(value), false));
            continue;
        }
        auto region = std::make_shared<RKMemoryRegion>();
        const bool wired = site.flags & VM_KERN_SITE_WIRED;
        const bool hidden = site.flags & VM_KERN_SITE_HIDE;
        // Memory that a zone, a user process or nobody in particular holds is not the site's
        // own dirty memory.
        if ((site.flags & VM_KERN_SITE_ZONE) || !wired || hidden || site.site == RKKernelTagUserWired) {
            region->cleanNonSpecSize = value;
            if (hidden) {
                region->detailedName = "(hidden)";
            } else if (site.site == RKKernelTagUserWired) {
                region->detailedName = "(user wired)";
            }
        } else {
            region->dirtySize = value;
        }
        if (region->detailedName.empty()) region->detailedName = site.detail;
        region->wired = wired;
        region->size = value;
        region->start = RKRegionNoAddress;
        region->share_mode = SM_PRIVATE;
        region->user_tag = static_cast<uint32_t>(i);
        region->object_id = i | kSiteObjectBase;
        region->name = _nameForWiredInfo(site, kexts, &zoneNames);
        regions.push_back(std::move(region));
    }
}

std::string RKKernelProcess::_nameForWiredInfo(const RKMemoryInfoRecord& site, const RKKextTags& kexts,
                                               const std::vector<RKZoneName>* zoneNames) {
    std::string name;
    if (site.flags & VM_KERN_SITE_NAMED) name = fixedName(site.name);
    if (name.empty()) name = nameByType(site, kexts);
    if (zoneNames && (site.flags & VM_KERN_SITE_ZONE) && site.zone < zoneNames->size()) {
        name += "[" + fixedName((*zoneNames)[site.zone].mzn_name) + "]";
    }
    return name.empty() ? "unknown" : name;
}

std::shared_ptr<RKAuxDataMap> RKKernelProcess::auxData() const {
    auto map = std::make_shared<RKAuxDataMap>();
    map->setObject("Maps", counters_ ? counters_ : std::make_shared<RKAuxDataMap>());
    return map;
}

std::optional<int64_t> RKKernelProcess::counter(const std::string& name) const {
    if (!counters_) return std::nullopt;
    auto node = std::dynamic_pointer_cast<const RKAuxData>(counters_->objectForKey(name));
    if (!node) return std::nullopt;
    return node->value();
}
