// Page queries on Linux: answered from the page data read ahead for the ranges a process is
// about to ask for (which also tells where nothing is, so the holes are never asked about), or
// read on the spot for a range nobody announced.
#include <algorithm>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTask.h"

namespace {

// What the walk knows of the VMA at `address`, for a range read without announcement.
RKPageQueryRange unannouncedRange(const RKLinuxTask& task, uint64_t address, uint64_t size) {
    RKPageQueryRange range{address, size, false, 0};
    if (!task.snapshot) return range;
    const auto& regions = task.snapshot->regions;
    auto it = std::upper_bound(regions.begin(), regions.end(), address,
                               [](uint64_t a, const RKLinuxRegion& r) { return a < r.vma.end; });
    if (it != regions.end() && it->vma.start <= address) {
        range.fileBacked = it->kind == RKVmaKind::File;
        range.reusablePages = it->info.pages_reusable;
    }
    return range;
}

}  // namespace

void RKLinuxPlatform::preparePageRangeQueries(RKTask& task, const std::vector<RKPageQueryRange>& ranges) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    if (!target) return;
    target->pageData.reset();
    if (ranges.empty()) return;
    target->pageData = std::make_unique<RKLinuxPageData>();
    RKReadPageData(target->directoryFd(), procRoot(), kernelPageSize(), ranges, *target->pageData);
}

kern_return_t RKLinuxPlatform::pageRangeQuery(RKTask& task, uint64_t address, uint64_t size, uint32_t* dispositions,
                                              uint64_t& count) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    const uint64_t page = kernelPageSize();
    const uint64_t pages = std::min(count, (size + page - 1) / page);
    count = 0;
    if (!target) return KERN_INVALID_ARGUMENT;
    std::span<uint32_t> out(dispositions, pages);
    if (target->pageData) {
        if (target->pageData->answer(address, page, out)) {
            count = pages;
            return KERN_SUCCESS;
        }
        if (target->pageData->result != KERN_SUCCESS) return target->pageData->result;
    }
    RKLinuxPageData data;
    kern_return_t result =
        RKReadPageData(target->directoryFd(), procRoot(), page, {unannouncedRange(*target, address, size)}, data);
    if (result != KERN_SUCCESS) return result;
    if (!data.answer(address, page, out)) return KERN_FAILURE;
    count = pages;
    return KERN_SUCCESS;
}

RKPageSpan RKLinuxPlatform::pageQueryPopulated(RKTask& task, uint64_t address, uint64_t end) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    RKPageSpan span{address, end};
    // Outside what was read ahead, ask: the query reads it, or tells why it cannot.
    if (!target || !target->pageData || !target->pageData->populated(address, end, kernelPageSize(), span.from, span.to))
        return {address, end};
    return span;
}

const RKLinuxPageProbe& RKLinuxPlatform::pageProbe() {
    // The probes of a root are kept for the program's life: the pointer stays good.
    const RKLinuxPageProbe* probe = pageProbe_.load(std::memory_order_acquire);
    if (!probe) {
        probe = &RKProbePageReading(procRoot());
        pageProbe_.store(probe, std::memory_order_release);
    }
    return *probe;
}

RKPageQueryAbilities RKLinuxPlatform::pageQueryAbilities() {
    const RKLinuxPageProbe& probe = pageProbe();
    return RKPageQueryAbilities{probe.kpageflags, probe.kpageflags};
}
