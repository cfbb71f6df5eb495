#include "output/RKOutputFormatterJSON.h"

#include <cstdio>

#include "model/RKAssert.h"
#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryRegion.h"
#include "model/RKTime.h"
#include "process/RKAnalysisSettings.h"

namespace {

// The kernel's page size, as the process layer gives it to a process that has none of its own.
uint64_t kernelPageSize() {
    RKProcess base;
    return base._gatherPageSize();
}

void writeUnsignedMember(RKJsonWriter& json, const char* key, uint64_t value) {
    json.key(key);
    json.unsignedValue(value);
}

// Size members of a region are left out when they are 0.
void writeNonZeroMember(RKJsonWriter& json, const char* key, uint64_t value) {
    if (value != 0) writeUnsignedMember(json, key, value);
}

void writeAuxValue(RKJsonWriter& json, const RKAuxJsonValue& value) {
    if (!value.isObject) {
        json.signedValue(value.number);
        return;
    }
    json.beginObject();
    for (const auto& [key, member] : value.members) {
        json.key(key);
        writeAuxValue(json, member);
    }
    json.endObject();
}

}  // namespace

std::shared_ptr<RKOutputFormatterJSON> RKOutputFormatterJSON::initWithPath(const std::string& path) {
    RKJsonWriter::File file(std::fopen(path.c_str(), "w+"));
    if (!file) {
        std::perror("Unable to open JSON writer");
        return nullptr;
    }
    return std::make_shared<RKOutputFormatterJSON>(Opened{}, std::make_unique<RKJsonWriter>(std::move(file)));
}

RKOutputFormatterJSON::RKOutputFormatterJSON(Opened, std::unique_ptr<RKJsonWriter> json) : json_(std::move(json)) {
    json_->beginObject();
    json_->key("unit");
    json_->stringValue("byte");
    json_->key("bytes per unit");
    json_->signedValue(1);
    if (!RKAnalysisSettings::breakDownPhysMemspread()) {
        json_->key("vm_object_dirty_analysis");
        json_->boolValue(true);
    }
}

RKJsonWriter& RKOutputFormatterJSON::_json() {
    RKAssert(json_ != nullptr, "RKOutputFormatterJSON", "JSON output used after close");
    return *json_;
}

// ---- Report frame ----

void RKOutputFormatterJSON::configureForMultipleOutputs() {
    if (multipleOutputs_) return;
    multipleOutputs_ = true;
    _json().key("samples");
    _json().beginArray();
}

void RKOutputFormatterJSON::startAtTime(const RKTime& time) {
    RKJsonWriter& json = _json();
    if (multipleOutputs_) json.beginObject();
    _writeTime("start_time", time);
    json.key("processes");
    json.beginArray();
    shared_.clear();
    addedProcessGroups_.clear();
}

void RKOutputFormatterJSON::endAtTime(const RKTime& time) {
    RKJsonWriter& json = _json();
    json.key("shared");
    json.beginArray();
    for (const auto& record : shared_) _writeSharedRecord(record);
    json.endArray();
    _writeTime("end_time", time);
    if (multipleOutputs_) json.endObject();
}

void RKOutputFormatterJSON::close() {
    if (!json_) return;
    if (multipleOutputs_) json_->endArray();
    if (pageSize_ == 0) pageSize_ = kernelPageSize();
    writeUnsignedMember(*json_, "page size", pageSize_);
    json_->endObject();
    json_->close();
    json_.reset();
}

// ---- Processes ----

void RKOutputFormatterJSON::printProcessHeader(const RKProcess& process) {
    RKJsonWriter& json = _json();
    json.beginObject();
    json.key("name");
    json.stringValue(process.name());
    json.key("pid");
    json.signedValue(process.pid());
    json.key("translated");
    json.boolValue(process.isTranslated());
    writeUnsignedMember(json, "page size", process.pageSize());
    const std::vector<std::string> errors = process.errors();
    if (!errors.empty()) _writeStrings("errors", errors);
    if (!process.warnings().empty()) _writeStrings("warnings", process.warnings());
    if (verbose_) {
        json.key("regions");
        json.beginArray();
        if (process.memoryRegions()) {
            for (const auto& region : *process.memoryRegions()) _writeRegion(*region);
        }
        json.endArray();
    }
    if (pageSize_ == 0) pageSize_ = process.pageSize();
}

void RKOutputFormatterJSON::printProcessTotal(uint64_t memspread, const RKProcess&) {
    writeUnsignedMember(_json(), "memspread", memspread);
}

void RKOutputFormatterJSON::printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal&) {
    _json().key("categories");
    _writeCategories(categories);
}

void RKOutputFormatterJSON::printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                                                  const RKProcess& process, bool hasProcessView,
                                                  const RKMemoryTotal&) {
    if (!hasProcessView && !addedProcessGroups_.insert(group.shared_from_this()).second) return;
    SharedRecord record;
    record.pids.reserve(group.count());
    for (const auto& member : group.processes()) record.pids.push_back(member->pid());
    if (hasProcessView) record.specificToPid = process.pid();
    record.categories = categories;
    shared_.push_back(std::move(record));
}

void RKOutputFormatterJSON::printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    _json().key("auxiliary");
    _writeAuxData(auxData);
    _json().endObject();
}

// ---- Report-wide members ----

void RKOutputFormatterJSON::printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                                       const RKProcessList& processesWithErrors,
                                                       const std::vector<std::string>& globalErrors) {
    _json().endArray();  // "processes"
    std::vector<std::string> errors = globalErrors;
    for (const auto& process : processesWithErrors) {
        const std::vector<std::string> own = process->errors();
        errors.insert(errors.end(), own.begin(), own.end());
    }
    _writeStrings("errors", errors);
    std::vector<std::string> warnings = std::move(globalWarnings_);
    globalWarnings_.clear();
    for (const auto& process : processesWithWarnings) {
        warnings.insert(warnings.end(), process->warnings().begin(), process->warnings().end());
    }
    _writeStrings("warnings", warnings);
}

void RKOutputFormatterJSON::printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                                   bool) {
    RKJsonWriter& json = _json();
    json.key("summary");
    json.beginObject();
    _writeCategoryMembers(categories);
    json.key("total");
    _writeTotal(total);
    json.endObject();
    writeUnsignedMember(json, "total memspread", total.dirty + total.swapped);
}

void RKOutputFormatterJSON::printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    _json().key("auxiliary");
    _writeAuxData(auxData);
}

// ---- Pieces ----

void RKOutputFormatterJSON::_writeStrings(const char* key, const std::vector<std::string>& strings) {
    RKJsonWriter& json = _json();
    json.key(key);
    json.beginArray();
    for (const auto& text : strings) json.stringValue(text);
    json.endArray();
}

void RKOutputFormatterJSON::_writeRegion(const RKMemoryRegion& region) {
    RKJsonWriter& json = _json();
    json.beginObject();
    writeUnsignedMember(json, "id", region.object_id);
    json.key("name");
    json.stringValue(region.fullName());
    if (region.start != RKRegionNoAddress) writeUnsignedMember(json, "addr", region.start);
    writeUnsignedMember(json, "vsize", region.size);
    writeNonZeroMember(json, "offset", region.offset);
    writeNonZeroMember(json, "dirty", region.dirtySize);
    writeNonZeroMember(json, "swapped", region.swappedSize);
    writeNonZeroMember(json, "clean", region.cleanNonSpecSize);
    writeNonZeroMember(json, "reclaimable", region.reclaimableSize);
    writeNonZeroMember(json, "wired", region.wiredSize());
    json.endObject();
}

void RKOutputFormatterJSON::_writeCategories(const RKCategoryMap& categories) {
    _json().beginObject();
    _writeCategoryMembers(categories);
    _json().endObject();
}

// Every category, verbose ones included, under its full name.
void RKOutputFormatterJSON::_writeCategoryMembers(const RKCategoryMap& categories) {
    for (const auto& entry : categories) {
        const RKMemoryCategory& category = *entry.second;
        _json().key(category.fullName());
        RKMemoryTotal sizes;
        sizes.dirty = category.totalDirtySize();
        sizes.swapped = category.totalSwappedSize();
        sizes.clean = category.totalCleanSize();
        sizes.reclaimable = category.totalReclaimableSize();
        sizes.wired = category.totalWiredSize();
        sizes.regions = static_cast<uint32_t>(category.totalRegions());
        _writeTotal(sizes);
    }
}

// "dirty" is the memspread of the set: dirty plus swapped.
void RKOutputFormatterJSON::_writeTotal(const RKMemoryTotal& total) {
    RKJsonWriter& json = _json();
    json.beginObject();
    writeUnsignedMember(json, "dirty", total.dirty + total.swapped);
    writeUnsignedMember(json, "swapped", total.swapped);
    writeUnsignedMember(json, "clean", total.clean);
    writeUnsignedMember(json, "reclaimable", total.reclaimable);
    writeUnsignedMember(json, "wired", total.wired);
    writeUnsignedMember(json, "regions", total.regions);
    json.endObject();
}

void RKOutputFormatterJSON::_writeAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    if (!auxData) {
        _json().nullValue();
        return;
    }
    writeAuxValue(_json(), auxData->jsonRepresentation());
}

void RKOutputFormatterJSON::_writeSharedRecord(const SharedRecord& record) {
    RKJsonWriter& json = _json();
    json.beginObject();
    json.key("pids");
    json.beginArray();
    for (pid_t pid : record.pids) json.signedValue(pid);
    json.endArray();
    if (record.specificToPid) {
        json.key("specific_to_pid");
        json.signedValue(*record.specificToPid);
    }
    json.key("categories");
    _writeCategories(record.categories);
    json.endObject();
}

void RKOutputFormatterJSON::_writeTime(const char* key, const RKTime& time) {
    RKJsonWriter& json = _json();
    json.key(key);
    json.beginObject();
    writeUnsignedMember(json, "mach_absolute_time_ns", time.machAbsoluteTimeNsec());
    writeUnsignedMember(json, "mach_continuous_time_ns", time.machContinuousTimeNsec());
    json.key("wall_time_s");
    json.secondsValue(time.wallTime());
    json.key("date");
    json.stringValue(dateFormatter_.stringFromDate(time.date()));
    json.endObject();
}
