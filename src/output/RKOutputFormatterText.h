// The human-readable report: a header and tables per process, one table per group of processes
// that share memory, auxiliary data, warnings and errors, and a summary over all processes.
// Always the first formatter of a run. Writes to `output` (standard output unless a test hands it
// another stream); the stream is borrowed, never closed.
#pragma once

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "output/RKOutputFormatter.h"
#include "output/RKTextCategorySort.h"
#include "output/RKTextSettings.h"
#include "output/RKTextTable.h"

class RKOutputFormatterText : public RKOutputFormatter {
public:
    // initWithSummaryFormat:options:sort: — `summaryFormat` is an RKSummaryFormat, `options` a
    // set of RKTextOption bits, `sort` one of RKTextSortColumns (any case); any other sort column
    // is a programming error and stops the program.
    RKOutputFormatterText(int64_t summaryFormat, int64_t options, std::string sort, FILE* output = stdout);

    const char* className() const override { return "RKOutputFormatterText"; }

    void printProcessHeader(const RKProcess& process) override;
    void endProcessHeader(const RKProcess& process) override;
    void printProcessTotal(uint64_t memspread, const RKProcess& process) override;
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) override;
    void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                               const RKProcess& process, bool hasProcessView,
                               const RKMemoryTotal& total) override;
    void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                    const RKProcessList& processesWithErrors,
                                    const std::vector<std::string>& globalErrors) override;
    void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                bool hadErrors) override;
    void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void endAtTime(const RKTime& time) override;

    bool implementsStartAtTime() const override { return true; }
    void startAtTime(const RKTime& time) override;
    bool implementsConfigureForMultipleOutputs() const override { return true; }
    void configureForMultipleOutputs() override { multipleOutputs_ = true; }
    bool implementsPrintSpanlistLikeOutput() const override { return true; }
    bool implementsPrintGlobalWarnings() const override { return true; }
    void printGlobalWarnings(const std::vector<std::string>& warnings) override {
        _printMessages("\nWarnings were encountered:\n", warnings);
    }
    void printSpanlistLikeOutputForProcess(const RKProcess& process, const RKRegionList& regions) override;

    int64_t summaryFormat() const { return summaryFormat_; }
    int64_t options() const { return options_; }
    const std::string& sort() const { return sort_; }
    bool multipleOutputs() const { return multipleOutputs_; }
    const std::optional<std::string>& swappedColumnName() const { return swappedColumnName_; }
    const std::optional<std::string>& wiredColumnName() const { return wiredColumnName_; }
    FILE* output() const { return output_; }

    // A byte count in the report's size format; pages are those of the last process header.
    std::string formattedStringForSize(int64_t size) const;
    // "Auxiliary data:" and the tree below it, one tab per level.
    void printAuxData(const RKAuxDataMap& auxData);

private:
    std::string _truncatedNameForString(const std::string& name) const;
    std::vector<RKTextSortedCategory> _sortedKeysForCategories(const RKCategoryMap& categories) const;
    void _printTableBody(const RKCategoryMap& categories, const RKMemoryTotal& total);
    void _printCategories(const RKCategoryMap& categories);
    void _printTotalFooter(const RKMemoryTotal& total);
    void _printAuxData(const RKAuxDataMap& auxData, int indent);
    void _printPhysMemspreadBreakdownEnabled();
    void _printSharingLine(const RKProcessGroup& group, const RKProcess& process);
    void _printMessages(const char* heading, const std::vector<std::string>& messages);

    uint8_t processCount_ = 0;  // headers since startAtTime, saturating at 2
    uint64_t pageSize_ = 0;     // of the process last given to printProcessHeader
    std::optional<std::string> swappedColumnName_;
    std::optional<std::string> wiredColumnName_;
    bool multipleOutputs_ = false;
    bool verbose_ = false;  // a region listing was printed
    int64_t summaryFormat_;
    int64_t options_;
    std::string sort_;
    FILE* output_;
    RKTextSortColumn sortColumn_;
    RKTextTable table_;
};
