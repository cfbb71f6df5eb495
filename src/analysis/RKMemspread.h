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
#include <memory>
#include <vector>

#include "model/RKTime.h"
#include "output/RKOutputFormatter.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKProcess.h"

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

    // Gathers every process; true when a cancel cut gathering short.
    bool gatherData();
    void cancel() { earlyExit_.store(true); }

    void analyzeData();
    void addOutputFormatter(std::shared_ptr<RKOutputFormatter> formatter);
    void printOutputVerbose(bool verbose, bool summarize);

    const RKProcessList& processes() const { return processes_; }
    uint32_t qualityOfService() const { return qualityOfService_; }
    void setQualityOfService(uint32_t qos) { qualityOfService_ = qos; }
    const std::optional<RKTime>& gatherStartTime() const { return gatherStartTime_; }
    const std::optional<RKTime>& gatherEndTime() const { return gatherEndTime_; }

private:
    RKProcessList processes_;
    RKOutputFormatterList outputFormatters_;
    std::atomic<bool> earlyExit_{false};
    uint32_t qualityOfService_ = QOS_CLASS_UTILITY;
    std::optional<RKTime> gatherStartTime_;
    std::optional<RKTime> gatherEndTime_;
    // The analysis state (identity maps, per-process totals) is added with the analysis.
};
