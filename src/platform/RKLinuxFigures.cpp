// Per-process figures from /proc/PID/status: the kernel's own cheap per-process count of the
// memory a process costs, and its page tables as the one ledger entry.
#include <algorithm>
#include <cerrno>

#include "platform/RKLinuxFrameVerdicts.h"
#include "platform/RKLinuxOwnedObjects.h"
#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTask.h"
#include "platform/RKProcFile.h"
#include "platform/RKProcStatusFigures.h"

namespace {

// 0 and the figures, or the errno; a process without memory figures (a zombie) is ESRCH. The
// rusage and the ledgers are asked one after the other: one read of status answers both.
int readFigures(RKTask& task, RKStatusFigures& figures) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    if (!target) return EINVAL;
    if (target->statusFigures) {
        figures = *target->statusFigures;
        return 0;
    }
    std::string text;
    int error = RKReadFileAt(target->directoryFd(), "status", text);
    if (error != 0) return error;
    auto parsed = RKParseStatusFigures(text);
    if (!parsed) return ESRCH;
    figures = *parsed;
    target->statusFigures = figures;
    return 0;
}

}  // namespace

int RKLinuxPlatform::pidRusage(RKTask& task, RKRusageInfo& info) {
    RKStatusFigures figures;
    if (int error = readFigures(task, figures)) return error;
    // Counts lazily freed pages and leaves out swapped shmem and memory held only through
    // descriptors: cheap, not exact (the walk's figure is the exact one).
    uint64_t kB = figures.rssAnon + figures.rssShmem + figures.vmSwap + figures.vmPTE + figures.hugetlbPages;
    info.ri_phys_memspread = kB * 1024;
    // Linux keeps no peak of that sum; the resident high-water mark is the nearest it has.
    info.ri_lifetime_max_phys_memspread = std::max(figures.vmHWM * 1024, info.ri_phys_memspread);
    return 0;
}

int RKLinuxPlatform::ledgerTemplate(std::vector<std::string>& names) {
    names = {"page_table"};
    return 0;
}

int RKLinuxPlatform::ledgerEntries(RKTask& task, std::vector<int64_t>& balances) {
    RKStatusFigures figures;
    if (int error = readFigures(task, figures)) return error;
    balances = {static_cast<int64_t>(figures.vmPTE * 1024)};
    return 0;
}

int RKLinuxPlatform::sysVSegments(std::vector<RKSysVSegment>& segments) {
    std::shared_ptr<const std::vector<RKSysVSegment>> table;
    const int error = sysV_->segments(table);
    if (error == 0) segments = *table;
    return error;
}

void RKLinuxPlatform::beginGather() {
    sysV_->begin();
    frameVerdicts_->begin();
}

void RKLinuxPlatform::endGather() {
    sysV_->end();
    frameVerdicts_->end();
}

int RKLinuxPlatform::ownedVmObjects(RKTask& task, std::vector<RKOwnedVmObjectRecord>& records) {
    auto* target = dynamic_cast<RKLinuxTask*>(&task);
    if (!target) return EINVAL;
    return RKReadOwnedObjects(*target, procRoot(), kernelPageSize(), *sysV_, records);
}
