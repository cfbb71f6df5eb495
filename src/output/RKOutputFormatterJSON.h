// The measurement as one JSON document in the file named by -j / --json, for programs to read.
// The document is streamed while the report is driven; only the shared-memory records wait for
// the end of their report. Its keys, their order, what is optional and the number formats are
// an external interface. The file is a complete document only once close() has run.
//
// Document: {"unit":"byte","bytes per unit":1,["vm_object_dirty_analysis":true,]
//   <report members> | "samples":[{<report members>},...], "page size":N}
// Report members: "start_time", "processes", "errors", "warnings", "summary",
//   "total memspread", "auxiliary", "shared", "end_time".
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "model/RKProcessGroup.h"
#include "output/RKJsonDateFormatter.h"
#include "output/RKJsonWriter.h"
#include "output/RKOutputFormatter.h"

class RKMemoryRegion;

class RKOutputFormatterJSON : public RKOutputFormatter {
public:
    // initWithPath: creates or truncates the file ("w+") and writes the root's opening members.
    // When it cannot be opened, writes "Unable to open JSON writer: <system error>" to standard
    // error and returns nullptr. The VM-object-dirty mark reflects the breakdown setting in force
    // now, so the driver must have set it.
    static std::shared_ptr<RKOutputFormatterJSON> initWithPath(const std::string& path);

    const char* className() const override { return "RKOutputFormatterJSON"; }

    void printProcessHeader(const RKProcess& process) override;
    void endProcessHeader(const RKProcess&) override {}  // the header needs no end mark
    void printProcessTotal(uint64_t memspread, const RKProcess& process) override;
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) override;
    // Writes nothing yet: the group is recorded and written at endAtTime. Without a process view
    // a group is recorded once per report; with one, once per call.
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
    // Every following report becomes one element of the "samples" array.
    bool implementsConfigureForMultipleOutputs() const override { return true; }
    void configureForMultipleOutputs() override;
    // Ends the document ("page size" last) and closes the file. No call may follow.
    bool implementsClose() const override { return true; }
    void close() override;
    // Records only that regions are wanted in the process objects.
    bool implementsPrintSpanlistLikeOutput() const override { return true; }
    // Kept for the report's "warnings", ahead of the processes' own.
    bool implementsPrintGlobalWarnings() const override { return true; }
    void printGlobalWarnings(const std::vector<std::string>& warnings) override { globalWarnings_ = warnings; }
    void printSpanlistLikeOutputForProcess(const RKProcess&, const RKRegionList&) override { verbose_ = true; }

    bool isOpen() const { return json_ != nullptr; }

private:
    struct Opened {};  // only initWithPath constructs

public:
    RKOutputFormatterJSON(Opened, std::unique_ptr<RKJsonWriter> json);

private:
    struct SharedRecord {
        std::vector<pid_t> pids;
        std::optional<pid_t> specificToPid;
        RKCategoryMap categories;
    };
    using GroupSet = std::unordered_set<std::shared_ptr<const RKProcessGroup>, RKProcessGroupHash,
                                        RKProcessGroupEqual>;

    RKJsonWriter& _json();
    void _writeStrings(const char* key, const std::vector<std::string>& strings);
    void _writeRegion(const RKMemoryRegion& region);
    void _writeCategories(const RKCategoryMap& categories);
    void _writeCategoryMembers(const RKCategoryMap& categories);
    void _writeTotal(const RKMemoryTotal& total);
    void _writeAuxData(const std::shared_ptr<RKAuxDataMap>& auxData);
    void _writeSharedRecord(const SharedRecord& record);
    void _writeTime(const char* key, const RKTime& time);

    bool verbose_ = false;
    bool multipleOutputs_ = false;
    std::vector<std::string> globalWarnings_;  // of the report being written
    std::vector<SharedRecord> shared_;
    GroupSet addedProcessGroups_;
    uint64_t pageSize_ = 0;
    std::unique_ptr<RKJsonWriter> json_;
    RKJsonDateFormatter dateFormatter_;
};
