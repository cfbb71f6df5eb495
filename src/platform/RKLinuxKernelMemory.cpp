#include "platform/RKLinuxKernelMemory.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "platform/RKLinuxKernelKinds.h"
#include "platform/RKMeminfoParser.h"
#include "platform/RKModulesParser.h"
#include "platform/RKSlabinfoParser.h"
#include "platform/RKVmallocinfoParser.h"

namespace {

using Meminfo = std::map<std::string, uint64_t, std::less<>>;

// vmalloc callers that allocate thread stacks: those pages are KernelStack already.
constexpr std::array<std::string_view, 6> kThreadStackCallers = {
    "kernel_clone", "fork_idle", "copy_process", "dup_task_struct", "alloc_thread_stack_node", "create_io_thread",
};
// vmalloc callers that allocate module memory: counted under the modules.
constexpr std::array<std::string_view, 5> kModuleCallers = {
    "module_memory_alloc", "module_alloc", "execmem_alloc", "execmem_vmalloc", "move_module",
};

template <size_t N>
bool contains(const std::array<std::string_view, N>& list, std::string_view name) {
    return std::find(list.begin(), list.end(), name) != list.end();
}

uint64_t figure(const Meminfo& meminfo, std::string_view name) {
    auto it = meminfo.find(name);
    return it == meminfo.end() ? 0 : it->second;
}

void copyName(std::string_view name, char (&out)[RK_ZONE_NAME_MAX]) {
    size_t length = std::min(name.size(), sizeof out);
    std::memcpy(out, name.data(), length);
}

void addZone(RKKernelMemoryInfo& info, std::string_view name, const RKZoneInfo& zone) {
    if (zone.mzi_cur_size == 0) return;
    RKZoneName zoneName;
    copyName(name, zoneName.mzn_name);
    info.zoneNames.push_back(zoneName);
    info.zones.push_back(zone);
}

RKZoneInfo plainZone(uint64_t bytes, bool collectable) {
    RKZoneInfo zone;
    zone.mzi_cur_size = zone.mzi_max_size = zone.mzi_sum_size = bytes;
    zone.mzi_collectable = collectable;
    return zone;
}

void addSite(RKKernelMemoryInfo& info, uint64_t flags, uint64_t site, uint64_t size, std::string_view name = {},
             std::string detail = {}) {
    if (size == 0) return;
    RKMemoryInfoRecord record;
    record.flags = flags;
    record.site = site;
    record.size = size;
    if (!name.empty()) {
        record.flags |= VM_KERN_SITE_NAMED;
        copyName(name, record.name);
    }
    record.detail = std::move(detail);
    info.sites.push_back(std::move(record));
}

void addTagSite(RKKernelMemoryInfo& info, uint64_t tag, uint64_t size, std::string detail = {}) {
    addSite(info, VM_KERN_SITE_TAG | VM_KERN_SITE_WIRED, tag, size, {}, std::move(detail));
}

// Slab caches as zones; the slab pages no cache accounts for are large kmalloc allocations,
// which go to the page allocator directly.
void addSlabZones(RKKernelMemoryInfo& info, const RKKernelMemorySources& sources, const Meminfo& meminfo) {
    const uint64_t slab = figure(meminfo, "Slab");
    std::vector<RKSlabCache> caches;
    if (!sources.slabinfo || !RKParseSlabinfo(*sources.slabinfo, caches).knownVersion) {
        // Without the caches: the kernel's own split into reclaimable and unreclaimable slab.
        addZone(info, "slab (unreclaimable)", plainZone(figure(meminfo, "SUnreclaim"), false));
        addZone(info, "slab (reclaimable)", plainZone(figure(meminfo, "SReclaimable"), true));
        return;
    }
    uint64_t cached = 0;
    for (const RKSlabCache& cache : caches) {
        RKZoneInfo zone;
        zone.mzi_count = cache.activeObjects;
        zone.mzi_elem_size = cache.objectSize;
        zone.mzi_alloc_size = cache.pagesPerSlab * sources.pageSize;
        zone.mzi_cur_size = zone.mzi_max_size = zone.mzi_sum_size = cache.slabs * zone.mzi_alloc_size;
        if (zone.mzi_cur_size == 0) continue;
        zone.mzi_collectable = sources.isReclaimable && sources.isReclaimable(cache.name);
        cached += zone.mzi_cur_size;
        addZone(info, cache.name, zone);
    }
    addZone(info, "kmalloc (large)", plainZone(slab > cached ? slab - cached : 0, false));
}

// vmalloc callers as kernel sites, modules as module sites, and VmallocUsed's rest.
void addVmallocSites(RKKernelMemoryInfo& info, const RKKernelMemorySources& sources, const Meminfo& meminfo,
                     uint64_t moduleBytes) {
    std::vector<RKVmallocArea> areas;
    RKParseVmallocinfo(*sources.vmallocinfo, areas);
    std::map<std::string_view, uint64_t> callers;  // ordered: a stable report
    uint64_t stackPages = 0;
    for (const RKVmallocArea& area : areas) {
        if (area.pages == 0 || area.caller.empty() || (area.flags & (RKVmallocIoremap | RKVmallocVmap))) continue;
        if (contains(kThreadStackCallers, area.caller)) {
            stackPages += area.pages;
        } else if (!(moduleBytes != 0 && contains(kModuleCallers, area.caller))) {
            callers[area.caller] += area.pages;
        }
    }
    uint64_t attributed = moduleBytes;
    uint64_t index = 0;
    for (const auto& [caller, pages] : callers) {
        attributed += pages * sources.pageSize;
        addSite(info, VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED, ++index, pages * sources.pageSize, caller,
                "(vmalloc)");
    }
    // Stacks the kernel keeps cached for the next fork are vmalloc'd but not in KernelStack:
    // they stay in the rest.
    attributed += std::min(stackPages * sources.pageSize, figure(meminfo, "KernelStack"));
    const uint64_t used = figure(meminfo, "VmallocUsed");
    addTagSite(info, RKKernelTagVmallocOther, used > attributed ? used - attributed : 0);
}

uint64_t addModuleSites(RKKernelMemoryInfo& info, const RKKernelMemorySources& sources) {
    if (!sources.modules) return 0;
    std::vector<RKKernelModule> modules;
    RKParseModules(*sources.modules, modules);
    uint64_t total = 0;
    for (size_t i = 0; i < modules.size(); ++i) {
        const uint64_t tag = i + 1;  // load tags: the position in the list, for this reading
        info.modules[tag] = std::string(modules[i].name);
        addSite(info, VM_KERN_SITE_KMOD | VM_KERN_SITE_WIRED, tag, modules[i].size);
        total += modules[i].size;
    }
    return total;
}

void addCounters(RKKernelMemoryInfo& info, const Meminfo& meminfo) {
    const uint64_t hugePageSize = figure(meminfo, "Hugepagesize");
    for (size_t i = 0; i < RKLinuxKernelCounters.size(); ++i) {
        std::string_view name = RKLinuxKernelCounters[i];
        auto it = meminfo.find(name);
        if (it == meminfo.end()) continue;
        RKMemoryInfoRecord record;
        record.flags = VM_KERN_SITE_COUNTER;
        record.site = i;
        record.mapped = name.substr(0, 10) == "HugePages_" ? it->second * hugePageSize : it->second;
        info.sites.push_back(std::move(record));
    }
}

}  // namespace

std::optional<RKKernelMemoryInfo> RKKernelMemoryFromSources(const RKKernelMemorySources& sources) {
    auto meminfo = RKParseMeminfo(sources.meminfo);
    if (!meminfo || !meminfo->count("MemTotal")) return std::nullopt;
    RKKernelMemoryInfo info;
    info.restricted = sources.restricted;
    addSlabZones(info, sources, *meminfo);
    addTagSite(info, RKKernelTagKernelStack, figure(*meminfo, "KernelStack"));
    addTagSite(info, RKKernelTagPageTables, figure(*meminfo, "PageTables"), "(processes' page tables included)");
    addTagSite(info, RKKernelTagSecPageTables, figure(*meminfo, "SecPageTables"), "(processes' page tables included)");
    addTagSite(info, RKKernelTagPercpu, figure(*meminfo, "Percpu"));
    const uint64_t moduleBytes = addModuleSites(info, sources);
    if (sources.vmallocinfo) addVmallocSites(info, sources, *meminfo, moduleBytes);
    addTagSite(info, RKKernelTagUserWired, figure(*meminfo, "Mlocked"));
    addCounters(info, *meminfo);
    return info;
}
