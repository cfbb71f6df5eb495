// A formatter that records every call it receives, with its arguments, so that tests can check
// what the analysis hands the formatters and in which order. Several recorders may share one
// journal to check how calls interleave across formatters.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "model/RKAuxData.h"
#include "model/RKCategoryMap.h"
#include "model/RKMemoryTotal.h"
#include "output/RKOutputFormatter.h"

class RKProcessGroup;

struct RKRecordedCall {
    std::string formatter;  // the recorder's label
    std::string name;       // the operation
    pid_t pid = 0;          // of the process argument, when there is one
    uint64_t memspread = 0;
    // A copy of the map: it keeps the categories alive, so that the address of a category
    // identifies the computation that made it for the rest of the test.
    RKCategoryMap categories;
    RKMemoryTotal total;
    bool hasProcessView = false;
    bool hadErrors = false;
    std::shared_ptr<const RKProcessGroup> group;  // kept alive as well
    std::vector<pid_t> groupPids;                  // ascending
    size_t regionCount = 0;
    std::shared_ptr<RKAuxDataMap> auxData;
    std::vector<pid_t> warningPids;
    std::vector<pid_t> errorPids;
    std::vector<std::string> globalErrors;
    double time = 0;  // wallTime of startAtTime / endAtTime

    // "label name" or "label name pid".
    std::string line() const;
    // The first category's address: equal for two calls exactly when they got the same map.
    const void* categoriesIdentity() const;
};

struct RKRecordingCapabilities {
    bool startAtTime = true;
    bool configureForMultipleOutputs = true;
    bool close = true;
    bool spanlistLikeOutput = true;
};

class RKRecordingFormatter : public RKOutputFormatter {
public:
    using Journal = std::vector<RKRecordedCall>;

    explicit RKRecordingFormatter(std::string label = "F", RKRecordingCapabilities capabilities = {},
                                  std::shared_ptr<Journal> journal = nullptr);

    // Every call recorded in the journal (of all recorders sharing it), in order.
    const Journal& calls() const { return *journal_; }
    std::vector<std::string> lines() const;
    // The calls of this recorder with the given operation name.
    std::vector<RKRecordedCall> callsNamed(const std::string& name) const;
    // Called after each call has been recorded.
    std::function<void(const RKRecordedCall&)> onCall;

    const char* className() const override { return "RKRecordingFormatter"; }
    void printProcessHeader(const RKProcess& process) override;
    void endProcessHeader(const RKProcess& process) override;
    void printProcessTotal(uint64_t memspread, const RKProcess& process) override;
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) override;
    void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group, const RKProcess& process,
                               bool hasProcessView, const RKMemoryTotal& total) override;
    void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                    const RKProcessList& processesWithErrors,
                                    const std::vector<std::string>& globalErrors) override;
    void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total, bool hadErrors) override;
    void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void endAtTime(const RKTime& time) override;

    bool implementsStartAtTime() const override { return capabilities_.startAtTime; }
    void startAtTime(const RKTime& time) override;
    bool implementsConfigureForMultipleOutputs() const override { return capabilities_.configureForMultipleOutputs; }
    void configureForMultipleOutputs() override;
    bool implementsClose() const override { return capabilities_.close; }
    void close() override;
    bool implementsPrintSpanlistLikeOutput() const override { return capabilities_.spanlistLikeOutput; }
    void printSpanlistLikeOutputForProcess(const RKProcess& process, const RKRegionList& regions) override;

private:
    RKRecordedCall& begin(const char* name);
    void finish();

    std::string label_;
    RKRecordingCapabilities capabilities_;
    std::shared_ptr<Journal> journal_;
};
