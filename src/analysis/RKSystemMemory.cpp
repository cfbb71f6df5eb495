#include "analysis/RKSystemMemory.h"

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "analysis/RKPointerSet.h"
#include "model/RKAuxData.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "process/RKKernelProcess.h"
#include "process/RKUserProcess.h"

namespace {

int64_t difference(int64_t total, int64_t part) { return std::max<int64_t>(total - part, 0); }

}  // namespace

RKSystemMemory RKAccountForSystemMemory(const RKProcessList& processes, bool breakDown) {
    RKSystemMemory result;
    const RKKernelProcess* kernel = nullptr;
    for (const auto& process : processes) {
        auto* candidate = dynamic_cast<const RKKernelProcess*>(process.get());
        if (candidate && candidate->errors().empty() && candidate->memoryRegions()) kernel = candidate;
    }
    if (!kernel || !kernel->counter("MemTotal")) return result;
    auto counter = [kernel](const char* name) { return kernel->counter(name).value_or(0); };

    // Every user process's memory once: each memory object whole, by identity.
    int64_t userMemory = 0, pageTables = 0;
    RKPointerSet seen;
    for (const auto& process : processes) {
        if (dynamic_cast<const RKKernelProcess*>(process.get())) continue;
        if (!process->memoryRegions() || !process->errors().empty()) {
            ++result.unreadableProcesses;
            continue;
        }
        for (const auto& region : *process->memoryRegions()) {
            const RKMemoryObject* object = region->memoryObjectPointer();
            if (!object || !RKFirstMeeting(seen, *object)) continue;
            userMemory += static_cast<int64_t>(object->totalDirtySize() + object->totalReclaimableSize() +
                                               object->totalCleanSize());
        }
        auto* user = dynamic_cast<const RKUserProcess*>(process.get());
        if (breakDown && user) pageTables += static_cast<int64_t>(user->ledgers());
    }

    // The kernel's own memory; memory it holds for others (user-wired pages) is theirs.
    int64_t kernelMemory = 0;
    for (const auto& region : *kernel->memoryRegions())
        kernelMemory += static_cast<int64_t>(region->dirtySize + region->reclaimableSize);
    // The processes' page tables are in the kernel's PageTables too; they stay with the processes.
    kernelMemory -= std::min(pageTables, counter("PageTables") + counter("SecPageTables"));

    const int64_t memTotal = counter("MemTotal");
    const std::pair<const char*, int64_t> terms[] = {
        {"free", counter("MemFree")},
        {"processes", userMemory},
        {"kernel", kernelMemory},
        {"page cache (not mapped)", difference(counter("Buffers") + counter("Cached"), counter("Mapped"))},
        {"huge pages (free)", difference(counter("Hugetlb"), counter("HugePages_Total") - counter("HugePages_Free"))},
        {"compressed swap pool", counter("Zswap")},
    };
    auto map = std::make_shared<RKAuxDataMap>();
    map->setObject("MemTotal", std::make_shared<RKAuxData>(memTotal, false));
    int64_t rest = memTotal;
    for (const auto& [name, value] : terms) {
        map->setObject(name, std::make_shared<RKAuxData>(value, false));
        rest -= value;
    }
    map->setObject("unattributed", std::make_shared<RKAuxData>(rest, false));
    result.map = std::move(map);
    return result;
}
