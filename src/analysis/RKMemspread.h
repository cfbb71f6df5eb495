// The analysis object: one instance measures one set of processes once. It gathers every
// process in parallel, identifies memory objects across processes, forms sharing groups,
// computes categories and totals and drives the formatters.
//
// Calling order: constructor, optionally setQualityOfService, gatherData (once), analyzeData,
// addOutputFormatter per formatter, printOutputVerbose. cancel() may come from any thread.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <future>
#include <memory>
#include <vector>

#include "analysis/RKAnalysisTypes.h"
#include "model/RKTime.h"
#include "output/RKOutputFormatter.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKProcess.h"

struct RKSystemMemory;

// Quality-of-service classes of the gathering threads (their niceness on Linux).
inline constexpr uint32_t QOS_CLASS_USER_INITIATED = 0x19;
inline constexpr uint32_t QOS_CLASS_UTILITY = 0x11;

// A SIGINT hook: while alive, SIGINT calls the handler on a dedicated thread.
class RKCancelSource;

class RKMemspread {
public:
    explicit RKMemspread(RKProcessList processes);  // initWithProcesses
    ~RKMemspread();

    // Class settings.
    static bool breakDownPhysMemspread() { return RKAnalysisSettings::breakDownPhysMemspread(); }
    static void setBreakDownPhysMemspread(bool on) { RKAnalysisSettings::setBreakDownPhysMemspread(on); }
    static bool isSharingAnalysisDisabled() { return RKAnalysisSettings::isSharingAnalysisDisabled(); }
    static void setSharingAnalysisDisabled(bool off) { RKAnalysisSettings::setSharingAnalysisDisabled(off); }

    // SIGINT is ignored and delivered to `handler` on its own thread until the returned source
    // is cancelled (destroyed), which restores SIGINT's default action.
    static std::unique_ptr<RKCancelSource> installCancelHandler(std::function<void()> handler);

    // Gathers every process, highest pid first, on one worker thread per online CPU; true when
    // a cancel cut gathering short (the lowest-pid process then carries a global error).
    bool gatherData();
    // The processes by descending pid (the gathering order).
    static RKProcessList _processesBySortingPidDesc(const RKProcessList& processes);
    static void _addUnheldMemoryWarnings(const RKProcessList& sortedByPidDesc);
    void cancel() { earlyExit_.store(true); }

    void analyzeData();
    void addOutputFormatter(std::shared_ptr<RKOutputFormatter> formatter);
    void printOutputVerbose(bool verbose, bool summarize);
    // What a report leaves: the processes with their regions, and the groups that hold the
    // memory objects.
    struct ReportRemains {
        RKProcessList processes;
        RKProcessToGroupsMap groups;
    };
    // For a run that exits after its report: printOutputVerbose then leaves the groups to
    // takeReportRemains rather than releasing them, object by object, before it returns.
    void setKeepsReportRemains(bool keep) { keepsReportRemains_ = keep; }
    // After printOutputVerbose; the analysis holds nothing of the report afterwards.
    ReportRemains takeReportRemains();
    // The verbose region listing, on the formatters that offer it.
    void printSpanlistLikeOutputForProcesses(const RKProcessList& processes);

    // ---- Steps of the analysis, public so that each can be checked on its own ----
    // Objects of ids that no other process can meet, process by process in parallel.
    void _identifyPrivateObjects();
    // The other regions of processes_[index], through the identity maps, in process order.
    void _addProcess(size_t index);
    // Anonymous pages shared across fork or by KSM, counted once (RKSharedAnonymousPass.cpp).
    void _attributeSharedAnonymousPages();
    void finalizeObjects();
    void _buildProcessToMemspreadMap();
    const RKPidToMemspreadMap& pidToMemspread() const { return pidToMemspread_; }
    // Null once the sharing groups have been built (the groups then hold the objects).
    const RKIdentityMaps* identityMaps() const { return identityMaps_.get(); }
    RKProcessList _notHiddenProcesses() const;
    // Larger memspread first, then larger pid.
    RKProcessList _processesBySortingMemspread(const RKProcessList& processes) const;
    // Breakdown on: the process's own dirty + swapped bytes; off: the whole dirty + swapped
    // bytes of every distinct object it maps.
    uint64_t _calculateMemspreadForProcess(const RKProcess& process) const;
    // The objects as `process` sees them, keyed by full name (by name when summarizing).
    // `processView`, when given, receives an RKProcessView.
    static std::shared_ptr<RKCategoryMap> _categoriesForObjects(const RKMemoryObjectList& objects,
                                                                const RKProcess& process, uint8_t* processView,
                                                                bool summarize);
    // Every object reached from a shown process, once and whole.
    RKCategoryMap _categoriesForAllProcessesShouldSummarize(bool summarize) const;
    static void _totalForCategories(const RKCategoryMap& categories, RKMemoryTotal* outTotal);
    // Ends the analysis state: the identity maps are released once the groups hold the objects.
    RKProcessToGroupsMap _generateProcessToProcessGroups();

    const RKProcessList& processes() const { return processes_; }
    uint32_t qualityOfService() const { return qualityOfService_; }
    void setQualityOfService(uint32_t qos) { qualityOfService_ = qos; }
    // Whether the processes are every process of the system (-a): the report then accounts for
    // the machine's memory in the global auxiliary data ("system").
    bool measuresWholeSystem() const { return measuresWholeSystem_; }
    void setMeasuresWholeSystem(bool value) { measuresWholeSystem_ = value; }
    const std::optional<RKTime>& gatherStartTime() const { return gatherStartTime_; }
    const std::optional<RKTime>& gatherEndTime() const { return gatherEndTime_; }

private:
    RKProcessList processes_;
    RKOutputFormatterList outputFormatters_;
    std::atomic<bool> earlyExit_{false};
    uint32_t qualityOfService_ = QOS_CLASS_UTILITY;
    bool measuresWholeSystem_ = false;
    bool keepsReportRemains_ = false;
    RKProcessToGroupsMap reportGroups_;  // kept for takeReportRemains
    std::optional<RKTime> gatherStartTime_;
    std::optional<RKTime> gatherEndTime_;
    // Analysis state: the identity maps live from analyzeData until the groups are built.
    RKPidToMemspreadMap pidToMemspread_;
    std::unique_ptr<RKIdentityMaps> identityMaps_;

    std::vector<bool> _privateIdsAlone() const;
    static bool _addRegionToObject(const std::shared_ptr<RKMemoryObject>& object,
                                   const std::shared_ptr<RKMemoryRegion>& region, const RKProcess& process,
                                   bool breakDown);

    struct ReportState;
    void _printReportedProcess(const std::shared_ptr<RKProcess>& process, const RKProcessToGroupsMap& groups,
                               bool summarize, ReportState& report);
    void _printProcessHeader(RKProcess& process, bool hasErrors);
    struct ReportTotals;
    std::future<ReportTotals> _startReportTotals(bool summarize) const;
    static void _addSystemMemory(const RKSystemMemory& system, ReportState& report);
    void _computePrivateGroupCategories(const RKProcessList& reported, const RKProcessToGroupsMap& groups,
                                        bool summarize);
    void _printProcessGroups(RKProcess& process, const RKProcessGroupList* groups, bool summarize);
    void _printGroup(RKProcessGroup& group, RKProcess& process, bool summarize);
};
