#include "output/RKOutputFormatterMetrilog.h"

#include <cstdio>

#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "process/RKAnalysisSettings.h"

namespace {

constexpr const char* kAllProcesses = "ALL_PROCESSES";
constexpr const char* kProcess = "process";
constexpr size_t kMetricNameCapacity = 1024;  // longer aux-data paths are cut to 1023 bytes

uint64_t memspreadOf(const RKMemoryCategory& category) {
    return category.totalDirtySize() + category.totalSwappedSize();
}

}  // namespace

std::shared_ptr<RKOutputFormatterMetrilog> RKOutputFormatterMetrilog::initWithPath(const std::string& path) {
    const char* logName = RKAnalysisSettings::breakDownPhysMemspread() ? "memspread.phys_memspread"
                                                                       : "memspread.vm_object_dirty";
    // A new file (truncate 1) that is flushed, not synced, at the end of every report (durable 0).
    mlwriter_t writer = mlwriter_open(path.c_str(), logName, 1, 0);
    if (!writer) {
        std::perror("Unable to open mlwriter");
        return nullptr;
    }
    mlwriter_set_description(writer, "Memory measurements gathered by the memspread(1) tool");
    mlwriter_set_primary_metric(writer, "total_memory,process=ALL_PROCESSES");
    return std::make_shared<RKOutputFormatterMetrilog>(Opened{}, writer);
}

RKOutputFormatterMetrilog::~RKOutputFormatterMetrilog() { close(); }

void RKOutputFormatterMetrilog::close() {
    if (!writer_) return;
    mlwriter_close(writer_);
    writer_ = nullptr;
}

void RKOutputFormatterMetrilog::startAtTime(const RKTime& time) { startTime_ = time; }

// The group is named after its process from the header on: a process with errors gets no total,
// and its aux data must not be recorded under the process before it.
void RKOutputFormatterMetrilog::printProcessHeader(const RKProcess& process) {
    mlwriter_new_group(writer_);
    currentProcess_ = process.name();
}

void RKOutputFormatterMetrilog::printProcessTotal(uint64_t memspread, const RKProcess& process) {
    mlwriter_new_value(writer_, "total_memory", mlunit_B, static_cast<double>(memspread));
    mlwriter_record_variable_str(writer_, kProcess, process.name().c_str());
    char pid[11];
    std::snprintf(pid, sizeof pid, "%d", static_cast<int>(process.pid()));
    mlwriter_record_label_str(writer_, "pid", pid);
    mlwriter_record_tag(writer_, mltag_summary);
    currentProcess_ = process.name();
}

void RKOutputFormatterMetrilog::printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal&) {
    currentProcessTotals_.emplace();
    _addCategories(categories);
}

void RKOutputFormatterMetrilog::printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup&,
                                                      const RKProcess&, bool, const RKMemoryTotal&) {
    if (currentProcessTotals_) _addCategories(categories);
}

void RKOutputFormatterMetrilog::_addCategories(const RKCategoryMap& categories) {
    for (const auto& entry : categories) {
        const RKMemoryCategory& category = *entry.second;
        (*currentProcessTotals_)[category.fullName()] += memspreadOf(category);
    }
}

void RKOutputFormatterMetrilog::printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    if (currentProcessTotals_) {
        for (const auto& [name, total] : *currentProcessTotals_) {
            mlwriter_new_value(writer_, name.c_str(), mlunit_B, static_cast<double>(total));
            mlwriter_record_variable_str(writer_, kProcess, currentProcess_.c_str());
        }
    }
    currentProcessTotals_.reset();
    _emitAuxData(auxData.get(), "aux_data", currentProcess_);
}

void RKOutputFormatterMetrilog::printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                                       bool) {
    mlwriter_new_group(writer_);
    mlwriter_new_value(writer_, "total_memory", mlunit_B, static_cast<double>(total.dirty + total.swapped));
    mlwriter_record_variable_str(writer_, kProcess, kAllProcesses);
    mlwriter_record_tag(writer_, mltag_summary);
    for (const auto& entry : categories) {
        const RKMemoryCategory& category = *entry.second;
        mlwriter_new_value(writer_, category.fullName().c_str(), mlunit_B, static_cast<double>(memspreadOf(category)));
        mlwriter_record_variable_str(writer_, kProcess, kAllProcesses);
    }
}

void RKOutputFormatterMetrilog::printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    _emitAuxData(auxData.get(), "aux_data", kAllProcesses);
}

// A map's leaves become metrics named by their key path ("aux_data.a.b"); no aux data at all
// counts as one leaf of 0, so every group says it had none.
void RKOutputFormatterMetrilog::_emitAuxData(const RKAuxDataType* node, const std::string& parentName,
                                             const std::string& processName) {
    if (node && node->isContainer()) {
        for (const auto& [key, child] : static_cast<const RKAuxDataMap*>(node)->entries()) {
            std::string childName = parentName + "." + key;
            if (childName.size() >= kMetricNameCapacity) childName.resize(kMetricNameCapacity - 1);
            _emitAuxData(child.get(), childName, processName);
        }
        return;
    }
    int64_t value = node ? static_cast<const RKAuxData*>(node)->value() : 0;
    mlwriter_new_value(writer_, parentName.c_str(), mlunit_B, static_cast<double>(value));
    mlwriter_record_variable_str(writer_, kProcess, processName.c_str());
    mlwriter_record_tag(writer_, mltag_context);
}

void RKOutputFormatterMetrilog::endAtTime(const RKTime& time) {
    uint64_t start = startTime_ ? startTime_->machContinuousTimeNsec() : time.machContinuousTimeNsec();
    uint64_t end = time.machContinuousTimeNsec();
    uint64_t milliseconds = end > start ? (end - start) / 1000000 : 0;
    mlwriter_new_value(writer_, "gather_duration", mlunit_ms, static_cast<double>(milliseconds));
    mlwriter_record_tag(writer_, mltag_context);
    mlwriter_flush(writer_);  // the report is complete: a crash later cannot take it
}
