#include "output/RKOutputFormatterText.h"

#include <cinttypes>

#include "model/RKAssert.h"
#include "model/RKAuxData.h"
#include "model/RKEscapedText.h"
#include "model/RKMemoryCategory.h"
#include "model/RKProcessGroup.h"
#include "model/RKTime.h"
#include "output/RKTextDate.h"
#include "output/RKTextNames.h"
#include "output/RKTextRegionListing.h"
#include "output/RKTextSizeFormat.h"
#include "process/RKAnalysisSettings.h"

namespace {

// A sharing group this large is summarised by its count rather than listed by name.
constexpr size_t kLargestListedGroup = 20;

std::optional<std::string> columnName(int64_t options, int64_t bit, const char* name) {
    if (!(options & bit)) return std::nullopt;
    return std::string(name);
}

RKTextSortColumn sortColumnNamed(const std::string& sort) {
    auto column = RKTextSortColumnNamed(sort);
    RKAssert(column.has_value(), "RKOutputFormatterText", "Unhandled text sort column");
    return *column;
}

}  // namespace

RKOutputFormatterText::RKOutputFormatterText(int64_t summaryFormat, int64_t options, std::string sort,
                                             FILE* output)
    : swappedColumnName_(columnName(options, RKTextOptionSwapped, "(Swapped)")),
      wiredColumnName_(columnName(options, RKTextOptionWired, "(Wired)")),
      summaryFormat_(summaryFormat),
      options_(options),
      sort_(std::move(sort)),
      output_(output),
      sortColumn_(sortColumnNamed(sort_)),
      table_(summaryFormat, swappedColumnName_, wiredColumnName_) {}

// ---- Shared pieces ----

std::string RKOutputFormatterText::formattedStringForSize(int64_t size) const {
    return RKTextFormattedSize(size, summaryFormat_, pageSize_);
}

std::string RKOutputFormatterText::_truncatedNameForString(const std::string& name) const {
    return RKTextTruncatedName(name, (options_ & RKTextOptionWide) != 0);
}

std::vector<RKTextSortedCategory> RKOutputFormatterText::_sortedKeysForCategories(
    const RKCategoryMap& categories) const {
    return RKTextSortedCategories(categories, sortColumn_);
}

void RKOutputFormatterText::_printTableBody(const RKCategoryMap& categories, const RKMemoryTotal& total) {
    table_.printHeader(output_);
    table_.printRule(output_);
    _printCategories(categories);
    _printTotalFooter(total);
}

void RKOutputFormatterText::_printCategories(const RKCategoryMap& categories) {
    for (const auto& [key, entry] : _sortedKeysForCategories(categories)) {
        const RKMemoryCategory& category = *entry;
        if (category.verbose() && !verbose_) continue;
        const std::string name = category.name();
        RKTextRow row;
        row.sizes = {
            formattedStringForSize(static_cast<int64_t>(category.totalDirtySize() + category.totalSwappedSize())),
            formattedStringForSize(static_cast<int64_t>(category.totalSwappedSize())),
            formattedStringForSize(static_cast<int64_t>(category.totalCleanSize())),
            formattedStringForSize(static_cast<int64_t>(category.totalReclaimableSize())),
            formattedStringForSize(static_cast<int64_t>(category.totalWiredSize())),
        };
        row.regions = category.totalRegions();
        row.name = RKEscapedText(name.empty() ? *key : name);
        row.detail = RKEscapedText(_truncatedNameForString(category.detailedName()));
        table_.printRow(output_, row);
    }
}

void RKOutputFormatterText::_printTotalFooter(const RKMemoryTotal& total) {
    table_.printRule(output_);
    RKTextRow row;
    row.sizes = {
        formattedStringForSize(static_cast<int64_t>(total.dirty + total.swapped)),
        formattedStringForSize(static_cast<int64_t>(total.swapped)),
        formattedStringForSize(static_cast<int64_t>(total.clean)),
        formattedStringForSize(static_cast<int64_t>(total.reclaimable)),
        formattedStringForSize(static_cast<int64_t>(total.wired)),
    };
    row.regions = total.regions;
    row.name = "TOTAL";
    table_.printRow(output_, row);
}

void RKOutputFormatterText::printAuxData(const RKAuxDataMap& auxData) {
    std::fputs("Auxiliary data:\n", output_);
    _printAuxData(auxData, 1);
}

void RKOutputFormatterText::_printAuxData(const RKAuxDataMap& auxData, int indent) {
    for (const auto& [key, node] : auxData.entries()) {
        if (!node) continue;
        for (int level = 0; level < indent; ++level) std::fputc('\t', output_);
        const std::string name = RKEscapedText(key);
        if (node->isContainer()) {
            std::fprintf(output_, "%s:\n", name.c_str());
            _printAuxData(static_cast<const RKAuxDataMap&>(*node), indent + 1);
        } else {
            const int64_t value = static_cast<const RKAuxData&>(*node).value();
            std::fprintf(output_, "%s: %s\n", name.c_str(), formattedStringForSize(value).c_str());
        }
    }
}

void RKOutputFormatterText::_printPhysMemspreadBreakdownEnabled() {
    if (!RKAnalysisSettings::breakDownPhysMemspread()) std::fputs("VM Object Dirty Analysis: Enabled\n", output_);
}

void RKOutputFormatterText::_printMessages(const char* heading, const std::vector<std::string>& messages) {
    std::fputs(heading, output_);
    for (const std::string& message : messages) std::fprintf(output_, "\t%s\n", RKEscapedText(message).c_str());
}

// ---- One report ----

void RKOutputFormatterText::startAtTime(const RKTime& time) {
    processCount_ = 0;
    if (multipleOutputs_) std::fprintf(output_, "Time: %s\n", RKTextLocalIsoDate(time.date()).c_str());
}

void RKOutputFormatterText::printSpanlistLikeOutputForProcess(const RKProcess& process, const RKRegionList& regions) {
    verbose_ = true;
    RKTextPrintRegionListing(output_, process, regions, options_);
}

void RKOutputFormatterText::printProcessHeader(const RKProcess& process) {
    if (processCount_ < 2) ++processCount_;
    pageSize_ = process.pageSize();
    table_.printSeparator(output_, false);
    std::fprintf(output_, "%s: %s-bit%s", RKEscapedText(process.displayString()).c_str(),
                 process.is64bit() ? "64" : "32", process.isTranslated() ? " (translated)" : "");
    if (!process.warnings().empty()) {
        _printMessages("\nWarnings were encountered while examining the process.\n", process.warnings());
    }
    const std::vector<std::string> errors = process.errors();
    if (!errors.empty()) {
        _printMessages("\nErrors were encountered while examining the process. No results gathered.\n", errors);
    }
}

void RKOutputFormatterText::printProcessTotal(uint64_t memspread, const RKProcess& process) {
    std::fprintf(output_, "\tMemspread: %s (%" PRIu64 " bytes per page)\n",
                 formattedStringForSize(static_cast<int64_t>(memspread)).c_str(), process.pageSize());
}

void RKOutputFormatterText::endProcessHeader(const RKProcess&) { table_.printSeparator(output_, true); }

void RKOutputFormatterText::printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) {
    _printTableBody(categories, total);
    std::fputs("\n", output_);
}

void RKOutputFormatterText::_printSharingLine(const RKProcessGroup& group, const RKProcess& process) {
    if (group.count() > kLargestListedGroup) {
        std::fprintf(output_, "Shared with %zu processes:\n", group.count());
        return;
    }
    std::string line = "Shared with";
    bool first = true;
    for (const auto& member : group.processes()) {
        if (!member || member->isEqual(process)) continue;
        if (!first) line += ',';
        line += ' ';
        line += RKEscapedText(member->displayString());
        first = false;
    }
    std::fprintf(output_, "%s:\n", line.c_str());
}

void RKOutputFormatterText::printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                                                  const RKProcess& process, bool, const RKMemoryTotal& total) {
    _printSharingLine(group, process);
    _printTableBody(categories, total);
    std::fputs("\n", output_);
}

void RKOutputFormatterText::printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    if (!auxData) return;
    printAuxData(*auxData);
    std::fputs("\n", output_);
}

void RKOutputFormatterText::printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                                       const RKProcessList& processesWithErrors,
                                                       const std::vector<std::string>& globalErrors) {
    auto names = [](const RKProcessList& processes) {
        std::vector<std::string> list;
        for (const auto& process : processes) {
            if (!process) continue;
            // A process that is not shown (one that could not be read) has no header that would
            // carry its warnings: they stand in for its name.
            if (process->hiddenFromDisplay())
                list.insert(list.end(), process->warnings().begin(), process->warnings().end());
            else
                list.push_back(process->name());
        }
        return list;
    };
    if (!processesWithWarnings.empty()) {
        _printMessages("\nWarnings were encountered while examining the following processes:\n",
                       names(processesWithWarnings));
    }
    if (!processesWithErrors.empty()) {
        _printMessages("\nErrors were encountered while examining the following processes:\n",
                       names(processesWithErrors));
    }
    if (!globalErrors.empty()) _printMessages("\nErrors were encountered:\n", globalErrors);
    if (!processesWithErrors.empty() || !globalErrors.empty()) {
        std::fputs("\nDue to errors, summary results may be invalid\n", output_);
    }
}

void RKOutputFormatterText::printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                                   bool hadErrors) {
    _printPhysMemspreadBreakdownEnabled();
    if (processCount_ == 1) return;
    table_.printSeparator(output_, false);
    std::fprintf(output_, "Summary Memspread: %s%s\n",
                 formattedStringForSize(static_cast<int64_t>(total.dirty + total.swapped)).c_str(),
                 hadErrors ? " (may be invalid due to errors)" : "");
    table_.printSeparator(output_, true);
    _printTableBody(categories, total);
}

void RKOutputFormatterText::printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    if (processCount_ == 1) return;
    std::fputs("\n", output_);
    if (!auxData) return;
    printAuxData(*auxData);
    std::fputs("\n", output_);
}

void RKOutputFormatterText::endAtTime(const RKTime&) { std::fflush(output_); }
