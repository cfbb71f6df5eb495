// The measurement as named numeric metrics in a metrics-log file (--metrilog): one group of
// values per process and one summary group per report, written through the metrics-log writer
// (docs/metrics-log.md). Every report reaches the file by its end, so a log of a sampling run
// cut short is complete up to the last sample written.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "model/RKAuxData.h"
#include "model/RKTime.h"
#include "output/RKMetricsLogWriter.h"
#include "output/RKOutputFormatter.h"

class RKOutputFormatterMetrilog : public RKOutputFormatter {
public:
    // initWithPath: creates the log anew. When it cannot be opened, writes
    // "Unable to open mlwriter: <system error>" to standard error and returns nullptr. The log is
    // named after the accounting mode in force when it is opened.
    static std::shared_ptr<RKOutputFormatterMetrilog> initWithPath(const std::string& path);

    const char* className() const override { return "RKOutputFormatterMetrilog"; }

    void printProcessHeader(const RKProcess& process) override;
    void endProcessHeader(const RKProcess&) override {}
    void printProcessTotal(uint64_t memspread, const RKProcess& process) override;
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) override;
    void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                               const RKProcess& process, bool hasProcessView,
                               const RKMemoryTotal& total) override;
    void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void printProcessesWithWarnings(const RKProcessList&, const RKProcessList&,
                                    const std::vector<std::string>&) override {}
    void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                bool hadErrors) override;
    void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void endAtTime(const RKTime& time) override;

    bool implementsStartAtTime() const override { return true; }
    void startAtTime(const RKTime& time) override;
    // Every sample simply adds its groups to the same log.
    bool implementsConfigureForMultipleOutputs() const override { return true; }
    void configureForMultipleOutputs() override {}
    bool implementsClose() const override { return true; }
    void close() override;

    bool isOpen() const { return writer_ != nullptr; }

private:
    struct Opened {};  // only initWithPath constructs

public:
    RKOutputFormatterMetrilog(Opened, mlwriter_t writer) : writer_(writer) {}
    ~RKOutputFormatterMetrilog() override;
    RKOutputFormatterMetrilog(const RKOutputFormatterMetrilog&) = delete;
    RKOutputFormatterMetrilog& operator=(const RKOutputFormatterMetrilog&) = delete;

private:
    void _addCategories(const RKCategoryMap& categories);
    void _emitAuxData(const RKAuxDataType* node, const std::string& parentName, const std::string& processName);

    mlwriter_t writer_;
    // The name of the process whose group is open; its values are recorded under it.
    std::string currentProcess_;
    // The open process's memspread per category full name, own and shared memory summed; none
    // before its own categories arrived.
    std::optional<std::map<std::string, uint64_t>> currentProcessTotals_;
    std::optional<RKTime> startTime_;
};
