// The gathering half of the analysis object: construction, the cancel flag and its SIGINT
// hook, and gatherData, which lets every process fill itself in parallel.
#include "analysis/RKMemspread.h"

#include <algorithm>

#include "analysis/RKCancelSource.h"
#include "platform/RKWorkerPool.h"
#include "process/RKGatherScope.h"
#include "process/RKUserProcess.h"

namespace {

constexpr const char* kEarlyExitError =
    "Memspread exited early due to SIGINT and did not finish gathering all data";

// Quality of service as niceness: utility runs below the caller, user-initiated with it.
int niceIncrementFor(uint32_t qualityOfService) { return qualityOfService == QOS_CLASS_UTILITY ? 5 : 0; }

}  // namespace

RKMemspread::RKMemspread(RKProcessList processes) : processes_(std::move(processes)) {}

RKMemspread::~RKMemspread() = default;

std::unique_ptr<RKCancelSource> RKMemspread::installCancelHandler(std::function<void()> handler) {
    return RKCancelSource::install(std::move(handler));
}

RKProcessList RKMemspread::_processesBySortingPidDesc(const RKProcessList& processes) {
    RKProcessList sorted = processes;
    std::stable_sort(sorted.begin(), sorted.end(),
                     [](const auto& a, const auto& b) { return a->pid() > b->pid(); });
    return sorted;
}

// Memory of the live system that no process holds reaches the report through the lowest-pid
// process shown. Snapshots alone say nothing of the live system.
void RKMemspread::_addUnheldMemoryWarnings(const RKProcessList& sortedByPidDesc) {
    std::shared_ptr<RKProcess> lowestShown;
    bool anyLive = false;
    for (const auto& process : sortedByPidDesc) {
        if (process->hiddenFromDisplay()) continue;
        lowestShown = process;
        anyLive = anyLive || process->_isAlive();
    }
    if (!anyLive) return;
    for (const std::string& warning : RKUserProcess::unheldSharedMemoryWarnings()) lowestShown->_addGlobalWarning(warning);
}

bool RKMemspread::gatherData() {
    RKProcessList sorted = _processesBySortingPidDesc(processes_);
    // The work goes costliest first; pids order only what a cancel leaves out, which is decided
    // by the order the processes start in, so ties keep the pid order.
    RKProcessList work = sorted;
    std::stable_sort(work.begin(), work.end(),
                     [](const auto& a, const auto& b) { return a->gatherCostHint() > b->gatherCostHint(); });
    RKGatherScope gather;
    gatherStartTime_ = RKTime::now();
    std::atomic<bool> cancelled{false};
    RKWorkerPoolOptions options;
    options.threads = RKOnlineCpuCount();
    options.niceIncrement = niceIncrementFor(qualityOfService_);
    // The cancel flag is read once per process, before it starts; a started process finishes.
    RKParallelApply(sorted.size(), options, [&](size_t i) {
        if (earlyExit_.load()) {
            cancelled.store(true);
            return;
        }
        work[i]->gatherData();
    });
    if (cancelled.load()) sorted.back()->_addGlobalError(kEarlyExitError);
    _addUnheldMemoryWarnings(sorted);
    gatherEndTime_ = RKTime::now();
    return cancelled.load();
}
