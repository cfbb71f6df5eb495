// The one contract between the analysis, which decides what is reported, and the formatters,
// which decide how it looks. One report is a fixed sequence of calls (RKMemspread drives it):
// startAtTime, [printSpanlistLikeOutputForProcess per process], then per process
// printProcessHeader, [printProcessTotal], endProcessHeader, category calls, printProcessAuxData;
// then printProcessesWithWarnings, printSummaryCategories, printGlobalAuxData, endAtTime.
// A formatter never asks the analysis for anything; everything arrives as arguments.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "model/RKCategoryMap.h"
#include "model/RKMemoryTotal.h"
#include "process/RKProcess.h"

class RKProcessGroup;
class RKTime;
class RKAuxDataMap;

using RKProcessList = std::vector<std::shared_ptr<RKProcess>>;

class RKOutputFormatter {
public:
    virtual ~RKOutputFormatter() = default;

    // The class name, for messages such as the sampling-mode refusal.
    virtual const char* className() const = 0;

    // ---- Required ----
    virtual void printProcessHeader(const RKProcess& process) = 0;
    virtual void endProcessHeader(const RKProcess& process) = 0;
    virtual void printProcessTotal(uint64_t memspread, const RKProcess& process) = 0;
    virtual void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) = 0;
    virtual void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                                       const RKProcess& process, bool hasProcessView,
                                       const RKMemoryTotal& total) = 0;
    virtual void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) = 0;
    // Optional: warnings about the system rather than one process (memory no process holds),
    // given just before printProcessesWithWarnings when there are any.
    virtual bool implementsPrintGlobalWarnings() const { return false; }
    virtual void printGlobalWarnings(const std::vector<std::string>&) {}
    virtual void printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                            const RKProcessList& processesWithErrors,
                                            const std::vector<std::string>& globalErrors) = 0;
    virtual void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                        bool hadErrors) = 0;
    virtual void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) = 0;
    virtual void endAtTime(const RKTime& time) = 0;

    // ---- Optional: callers test the capability first ----
    virtual bool implementsStartAtTime() const { return false; }
    virtual void startAtTime(const RKTime&) {}
    virtual bool implementsConfigureForMultipleOutputs() const { return false; }
    virtual void configureForMultipleOutputs() {}
    virtual bool implementsClose() const { return false; }
    virtual void close() {}
    virtual bool implementsPrintSpanlistLikeOutput() const { return false; }
    virtual void printSpanlistLikeOutputForProcess(const RKProcess& process, const RKRegionList& regions) {
        (void)process;
        (void)regions;
    }
};

using RKOutputFormatterList = std::vector<std::shared_ptr<RKOutputFormatter>>;
