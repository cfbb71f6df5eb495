// Driving the formatters through one report. Every step calls the formatters in the order they
// were added, the formatter loop being the innermost loop.
#include "analysis/RKMemspread.h"

#include <algorithm>
#include <future>
#include <unordered_map>
#include <utility>
#include <vector>

#include "analysis/RKSystemMemory.h"
#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKProcessGroup.h"
#include "platform/RKWorkerPool.h"
#include "process/RKUnreadProcess.h"

namespace {

// A group this large computes its categories once for all members, when they look the same to
// every member.
constexpr size_t kCachedCategoriesMinimumGroupSize = 26;

// Formatters get a time even when the clocks could not be read.
const RKTime& timeOrZero(const std::optional<RKTime>& time) {
    static const RKTime zero = RKTime::fromReadings(RKClockReadings{});
    return time ? *time : zero;
}

}  // namespace

void RKMemspread::addOutputFormatter(std::shared_ptr<RKOutputFormatter> formatter) {
    outputFormatters_.push_back(std::move(formatter));
}

void RKMemspread::printSpanlistLikeOutputForProcesses(const RKProcessList& processes) {
    RKOutputFormatterList listing;
    for (const auto& formatter : outputFormatters_) {
        if (formatter->implementsPrintSpanlistLikeOutput()) listing.push_back(formatter);
    }
    if (listing.empty()) return;
    static const RKRegionList kNoRegions;
    for (const auto& process : processes) {
        const RKRegionList& regions = process->memoryRegions() ? *process->memoryRegions() : kNoRegions;
        for (const auto& formatter : listing) formatter->printSpanlistLikeOutputForProcess(*process, regions);
    }
}

struct RKMemspread::ReportState {
    RKProcessList withWarnings;
    RKProcessList withErrors;
    std::vector<std::string> globalErrors;
    std::vector<std::string> globalWarnings;
    std::shared_ptr<RKAuxDataMap> globalAuxData;  // of the processes without errors
};

// What the end of the report needs of every object at once.
struct RKMemspread::ReportTotals {
    RKCategoryMap summary;
    RKSystemMemory system;
};

void RKMemspread::printOutputVerbose(bool verbose, bool summarize) {
    const RKProcessList reported = _processesBySortingMemspread(_notHiddenProcesses());
    for (const auto& formatter : outputFormatters_) {
        if (formatter->implementsStartAtTime()) formatter->startAtTime(timeOrZero(gatherStartTime_));
    }
    if (verbose) printSpanlistLikeOutputForProcesses(reported);

    // The summary's categories and the system's memory only read the objects and regions: they
    // are found on a thread of their own while the groups are found and the processes reported.
    // Objects that only hidden processes map are released at the end of the groups walk: with
    // hidden processes, that thread starts after it.
    std::future<ReportTotals> totals;
    const bool anyHidden = std::any_of(processes_.begin(), processes_.end(),
                                       [](const auto& process) { return process->hiddenFromDisplay(); });
    if (!anyHidden) totals = _startReportTotals(summarize);
    // From here on the groups, categories and views hold the memory objects.
    RKProcessToGroupsMap groups = _generateProcessToProcessGroups();
    if (anyHidden) totals = _startReportTotals(summarize);

    _computePrivateGroupCategories(reported, groups, summarize);
    ReportState report;
    for (const auto& process : reported) _printReportedProcess(process, groups, summarize, report);
    const ReportTotals found = totals.get();
    if (measuresWholeSystem_) _addSystemMemory(found.system, report);
    // Processes that could not be opened are never shown, but the run names them.
    for (const auto& process : processes_) {
        if (dynamic_cast<const RKUnreadProcess*>(process.get())) report.withWarnings.push_back(process);
    }
    for (const auto& formatter : outputFormatters_) {
        if (!report.globalWarnings.empty() && formatter->implementsPrintGlobalWarnings())
            formatter->printGlobalWarnings(report.globalWarnings);
        formatter->printProcessesWithWarnings(report.withWarnings, report.withErrors, report.globalErrors);
    }

    const RKCategoryMap& summary = found.summary;
    RKMemoryTotal summaryTotal;
    _totalForCategories(summary, &summaryTotal);
    const bool hadErrors = !report.globalErrors.empty() || !report.withErrors.empty();
    for (const auto& formatter : outputFormatters_) {
        formatter->printSummaryCategories(summary, summaryTotal, hadErrors);
        formatter->printGlobalAuxData(report.globalAuxData);
        formatter->endAtTime(timeOrZero(gatherEndTime_));
    }
    if (keepsReportRemains_) reportGroups_ = std::move(groups);
}

RKMemspread::ReportRemains RKMemspread::takeReportRemains() {
    ReportRemains remains{std::move(processes_), std::move(reportGroups_)};
    processes_.clear(), reportGroups_.clear();
    pidToMemspread_.clear();
    return remains;
}

// Most objects are in the processes' private groups, whose categories depend on nothing else:
// they are computed side by side before the report is written in order, and reach _printGroup
// through the group's cache. A group listed twice (processes of one pid) is left to _printGroup.
void RKMemspread::_computePrivateGroupCategories(const RKProcessList& reported, const RKProcessToGroupsMap& groups,
                                                 bool summarize) {
    std::vector<std::pair<RKProcessGroup*, const RKProcess*>> work;
    std::unordered_map<const RKProcessGroup*, uint32_t> listings;
    for (const auto& process : reported) {
        auto list = groups.find(process->pid());
        if (list == groups.end() || list->second.front()->count() != 1) continue;
        listings[list->second.front().get()]++;
        if (process->errors().empty()) work.emplace_back(list->second.front().get(), process.get());
    }
    std::erase_if(work, [&](const auto& item) { return listings[item.first] != 1; });
    RKParallelApplyOnEveryCpu(work.size(), [&](size_t i) {
        auto [group, process] = work[i];
        group->attachCachedCategories(_categoriesForObjects(group->objects(), *process, nullptr, summarize), 1);
    });
}

std::future<RKMemspread::ReportTotals> RKMemspread::_startReportTotals(bool summarize) const {
    const bool breakDown = breakDownPhysMemspread();  // read here: the setting is cached on first read
    // Deferred to get() where no thread can be started.
    return std::async(std::launch::async | std::launch::deferred, [this, summarize, breakDown] {
        ReportTotals totals{_categoriesForAllProcessesShouldSummarize(summarize), {}};
        if (measuresWholeSystem_) totals.system = RKAccountForSystemMemory(processes_, breakDown);
        return totals;
    });
}

void RKMemspread::_addSystemMemory(const RKSystemMemory& system, ReportState& report) {
    if (!system.map) return;
    if (!report.globalAuxData) report.globalAuxData = std::make_shared<RKAuxDataMap>();
    report.globalAuxData->setObject("system", system.map);
    if (system.unreadableProcesses != 0) {
        report.globalErrors.push_back(std::to_string(system.unreadableProcesses) +
                                      " processes could not be read: their memory is in the system's \"unattributed\"");
    }
}

void RKMemspread::_printReportedProcess(const std::shared_ptr<RKProcess>& reported,
                                        const RKProcessToGroupsMap& groups, bool summarize, ReportState& report) {
    RKProcess& process = *reported;
    const bool hasErrors = !process.errors().empty();
    if (!process.warnings().empty()) report.withWarnings.push_back(reported);
    std::shared_ptr<RKAuxDataMap> auxData = process.auxData();
    if (hasErrors) {
        report.withErrors.push_back(reported);
    } else if (auxData) {
        // The process's own leaves decide what is aggregated.
        report.globalAuxData = auxData->mergeWithData(report.globalAuxData);
    }

    _printProcessHeader(process, hasErrors);
    auto list = groups.find(process.pid());
    _printProcessGroups(process, hasErrors || list == groups.end() ? nullptr : &list->second, summarize);
    for (const auto& formatter : outputFormatters_) formatter->printProcessAuxData(auxData);

    const auto& errors = process.globalErrors();
    report.globalErrors.insert(report.globalErrors.end(), errors.begin(), errors.end());
    const auto& warnings = process.globalWarnings();
    report.globalWarnings.insert(report.globalWarnings.end(), warnings.begin(), warnings.end());
}

void RKMemspread::_printProcessHeader(RKProcess& process, bool hasErrors) {
    auto entry = pidToMemspread_.find(process.pid());
    const uint64_t memspread = entry == pidToMemspread_.end() ? 0 : entry->second;
    for (const auto& formatter : outputFormatters_) {
        formatter->printProcessHeader(process);
        if (!hasErrors) formatter->printProcessTotal(memspread, process);
        formatter->endProcessHeader(process);
    }
}

// `groups` is null for a process with errors or without groups: it gets one empty table.
void RKMemspread::_printProcessGroups(RKProcess& process, const RKProcessGroupList* groups, bool summarize) {
    if (!groups) {
        const RKCategoryMap none;
        const RKMemoryTotal zero;
        for (const auto& formatter : outputFormatters_) formatter->printProcessCategories(none, zero);
        return;
    }
    for (const auto& group : *groups) _printGroup(*group, process, summarize);
}

void RKMemspread::_printGroup(RKProcessGroup& group, RKProcess& process, bool summarize) {
    uint8_t processView = RKProcessViewNone;
    std::shared_ptr<RKCategoryMap> categories = group.consumeCachedCategories();
    if (!categories) {
        categories = _categoriesForObjects(group.objects(), process, &processView, summarize);
        // Identical for every member: the others take this map instead of computing it again.
        if (processView == RKProcessViewNone && group.count() >= kCachedCategoriesMinimumGroupSize) {
            group.attachCachedCategories(categories, static_cast<uint32_t>(group.count() - 1));
        }
    }
    RKMemoryTotal total;
    _totalForCategories(*categories, &total);
    const bool hasProcessView = processView == RKProcessViewPresent;
    for (const auto& formatter : outputFormatters_) {
        if (group.count() == 1) {
            formatter->printProcessCategories(*categories, total);
        } else {
            formatter->printSharedCategories(*categories, group, process, hasProcessView, total);
        }
    }
}
