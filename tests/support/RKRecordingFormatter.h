// A formatter that records every call it receives as one line of text with its arguments, so
// that tests can compare what the analysis hands the formatters, and in which order, with
// expected text. Several recorders may share one journal to show how calls interleave.
//
// Line format: "<label> <operation>[ <pid>][ <arguments>]". Totals list their non-zero sizes
// ("dirty=8192 clean=4096 regions=2"), category maps their keys ("[mapped file /a]"), shared
// categories their group ("with=10,20") and "view" when the process has a view of its own. Files
// of expected journals may explain themselves in "#" comment lines.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

#include "model/RKAuxData.h"
#include "model/RKCategoryMap.h"
#include "model/RKMemoryTotal.h"
#include "model/RKProcessGroup.h"
#include "output/RKOutputFormatter.h"
#include "support/RKRunCommand.h"

struct RKRecordedCall {
    std::string formatter;  // the recorder's label
    std::string name;       // the operation
    pid_t pid = 0;          // of the process argument, when there is one
    std::string arguments;  // the others, as text
    // A copy of the category map: it keeps the categories alive, so that the address of a
    // category identifies the computation that made it for the rest of the test.
    RKCategoryMap categories;

    std::string line() const {
        return formatter + " " + name + (pid != 0 ? " " + std::to_string(pid) : "") + arguments;
    }
    // The first category's address: equal for two calls exactly when they got the same map.
    const void* categoriesIdentity() const { return categories.empty() ? nullptr : categories.begin()->second.get(); }
};

class RKRecordingFormatter : public RKOutputFormatter {
public:
    using Journal = std::vector<RKRecordedCall>;

    // optionalCalls: whether it implements startAtTime and the region listing.
    explicit RKRecordingFormatter(std::string label = "F", bool optionalCalls = true,
                                  std::shared_ptr<Journal> journal = std::make_shared<Journal>())
        : label_(std::move(label)), optionalCalls_(optionalCalls), journal_(std::move(journal)) {}

    // Every call in the journal (of all recorders sharing it), in order, one line each.
    std::string journalText() const {
        std::string text;
        for (const auto& call : *journal_) text += call.line() + "\n";
        return text;
    }
    // The calls of this recorder with the given operation name.
    std::vector<RKRecordedCall> callsNamed(const std::string& name) const {
        std::vector<RKRecordedCall> result;
        for (const auto& call : *journal_) {
            if (call.formatter == label_ && call.name == name) result.push_back(call);
        }
        return result;
    }

    const char* className() const override { return "RKRecordingFormatter"; }
    void printProcessHeader(const RKProcess& process) override { record("printProcessHeader", process.pid()); }
    void endProcessHeader(const RKProcess& process) override { record("endProcessHeader", process.pid()); }
    void printProcessTotal(uint64_t memspread, const RKProcess& process) override {
        record("printProcessTotal", process.pid(), " memspread=" + std::to_string(memspread));
    }
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) override {
        record("printProcessCategories", 0, describe(categories, total), categories);
    }
    void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group, const RKProcess& process,
                               bool hasProcessView, const RKMemoryTotal& total) override {
        std::string arguments = " with=" + pidList(group.processes()) + (hasProcessView ? " view" : "");
        record("printSharedCategories", process.pid(), arguments + describe(categories, total), categories);
    }
    void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override {
        record("printProcessAuxData", 0, describe(auxData));
    }
    void printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                    const RKProcessList& processesWithErrors,
                                    const std::vector<std::string>& globalErrors) override {
        std::string arguments = " warnings=" + pidList(processesWithWarnings);
        arguments += " errors=" + pidList(processesWithErrors);
        for (const auto& error : globalErrors) arguments += " [" + error + "]";
        record("printProcessesWithWarnings", 0, arguments);
    }
    void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total, bool hadErrors) override {
        record("printSummaryCategories", 0, describe(categories, total) + (hadErrors ? " hadErrors" : ""), categories);
    }
    void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override {
        record("printGlobalAuxData", 0, describe(auxData));
    }
    void endAtTime(const RKTime&) override { record("endAtTime"); }

    bool implementsStartAtTime() const override { return optionalCalls_; }
    void startAtTime(const RKTime&) override { record("startAtTime"); }
    bool implementsPrintSpanlistLikeOutput() const override { return optionalCalls_; }
    void printSpanlistLikeOutputForProcess(const RKProcess& process, const RKRegionList&) override {
        record("printSpanlistLikeOutputForProcess", process.pid());
    }

private:
    void record(const char* name, pid_t pid = 0, std::string arguments = "", RKCategoryMap categories = {}) {
        journal_->push_back({label_, name, pid, std::move(arguments), std::move(categories)});
    }

    // "10,20", or "-" for none.
    template <class Processes>
    static std::string pidList(const Processes& processes) {
        std::string text;
        for (const auto& process : processes) text += (text.empty() ? "" : ",") + std::to_string(process->pid());
        return text.empty() ? "-" : text;
    }

    static std::string describe(const RKCategoryMap& categories, const RKMemoryTotal& total) {
        std::string text;
        const std::pair<const char*, uint64_t> sizes[] = {
            {"dirty", total.dirty}, {"swapped", total.swapped}, {"clean", total.clean},
            {"reclaimable", total.reclaimable}, {"wired", total.wired}, {"regions", total.regions}};
        for (const auto& [label, size] : sizes) {
            if (size != 0) text += " " + std::string(label) + "=" + std::to_string(size);
        }
        for (const auto& entry : categories) text += " [" + entry.first + "]";
        return text;
    }

    // The leaves at the top of the tree, as " key=value".
    static std::string describe(const std::shared_ptr<RKAuxDataMap>& auxData) {
        std::string text;
        for (const auto& [key, node] : auxData ? auxData->entries() : RKAuxDataMap::Entries{}) {
            auto leaf = std::dynamic_pointer_cast<const RKAuxData>(node);
            if (leaf) text += " " + key + "=" + std::to_string(leaf->value());
        }
        return text;
    }

    std::string label_;
    bool optionalCalls_;
    std::shared_ptr<Journal> journal_;
};

// The expected journal in tests/data/golden/`name`, without its "#" comment lines.
inline std::string RKExpectedJournal(const std::string& name) {
    std::string text;
    for (const std::string& line : RKSplitLines(RKFileText(std::string(MEMSPREAD_TEST_DATA) + "/golden/" + name)))
        if (!line.starts_with("#")) text += line + "\n";
    return text;
}
