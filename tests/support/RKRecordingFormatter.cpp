#include "support/RKRecordingFormatter.h"

#include "model/RKMemoryCategory.h"
#include "model/RKProcessGroup.h"
#include "model/RKTime.h"

namespace {

std::vector<pid_t> pidsOf(const RKProcessList& processes) {
    std::vector<pid_t> pids;
    for (const auto& process : processes) pids.push_back(process->pid());
    return pids;
}

}  // namespace

std::string RKRecordedCall::line() const {
    std::string text = formatter + " " + name;
    bool hasProcess = name == "printProcessHeader" || name == "endProcessHeader" || name == "printProcessTotal" ||
                      name == "printSharedCategories" || name == "printSpanlistLikeOutputForProcess";
    if (hasProcess) text += " " + std::to_string(pid);
    return text;
}

const void* RKRecordedCall::categoriesIdentity() const {
    return categories.empty() ? nullptr : categories.begin()->second.get();
}

RKRecordingFormatter::RKRecordingFormatter(std::string label, RKRecordingCapabilities capabilities,
                                           std::shared_ptr<Journal> journal)
    : label_(std::move(label)),
      capabilities_(capabilities),
      journal_(journal ? std::move(journal) : std::make_shared<Journal>()) {}

std::vector<std::string> RKRecordingFormatter::lines() const {
    std::vector<std::string> result;
    for (const auto& call : *journal_) result.push_back(call.line());
    return result;
}

std::vector<RKRecordedCall> RKRecordingFormatter::callsNamed(const std::string& name) const {
    std::vector<RKRecordedCall> result;
    for (const auto& call : *journal_) {
        if (call.formatter == label_ && call.name == name) result.push_back(call);
    }
    return result;
}

RKRecordedCall& RKRecordingFormatter::begin(const char* name) {
    RKRecordedCall& call = journal_->emplace_back();
    call.formatter = label_;
    call.name = name;
    return call;
}

void RKRecordingFormatter::finish() {
    if (onCall) onCall(journal_->back());
}

void RKRecordingFormatter::printProcessHeader(const RKProcess& process) {
    begin("printProcessHeader").pid = process.pid();
    finish();
}

void RKRecordingFormatter::endProcessHeader(const RKProcess& process) {
    begin("endProcessHeader").pid = process.pid();
    finish();
}

void RKRecordingFormatter::printProcessTotal(uint64_t memspread, const RKProcess& process) {
    RKRecordedCall& call = begin("printProcessTotal");
    call.pid = process.pid();
    call.memspread = memspread;
    finish();
}

void RKRecordingFormatter::printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) {
    RKRecordedCall& call = begin("printProcessCategories");
    call.categories = categories;
    call.total = total;
    finish();
}

void RKRecordingFormatter::printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                                                 const RKProcess& process, bool hasProcessView,
                                                 const RKMemoryTotal& total) {
    RKRecordedCall& call = begin("printSharedCategories");
    call.categories = categories;
    call.group = group.shared_from_this();
    for (const auto& member : group.processes()) call.groupPids.push_back(member->pid());
    call.pid = process.pid();
    call.hasProcessView = hasProcessView;
    call.total = total;
    finish();
}

void RKRecordingFormatter::printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    begin("printProcessAuxData").auxData = auxData;
    finish();
}

void RKRecordingFormatter::printProcessesWithWarnings(const RKProcessList& processesWithWarnings,
                                                      const RKProcessList& processesWithErrors,
                                                      const std::vector<std::string>& globalErrors) {
    RKRecordedCall& call = begin("printProcessesWithWarnings");
    call.warningPids = pidsOf(processesWithWarnings);
    call.errorPids = pidsOf(processesWithErrors);
    call.globalErrors = globalErrors;
    finish();
}

void RKRecordingFormatter::printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                                  bool hadErrors) {
    RKRecordedCall& call = begin("printSummaryCategories");
    call.categories = categories;
    call.total = total;
    call.hadErrors = hadErrors;
    finish();
}

void RKRecordingFormatter::printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) {
    begin("printGlobalAuxData").auxData = auxData;
    finish();
}

void RKRecordingFormatter::endAtTime(const RKTime& time) {
    begin("endAtTime").time = time.wallTime();
    finish();
}

void RKRecordingFormatter::startAtTime(const RKTime& time) {
    begin("startAtTime").time = time.wallTime();
    finish();
}

void RKRecordingFormatter::configureForMultipleOutputs() {
    begin("configureForMultipleOutputs");
    finish();
}

void RKRecordingFormatter::close() {
    begin("close");
    finish();
}

void RKRecordingFormatter::printSpanlistLikeOutputForProcess(const RKProcess& process, const RKRegionList& regions) {
    RKRecordedCall& call = begin("printSpanlistLikeOutputForProcess");
    call.pid = process.pid();
    call.regionCount = regions.size();
    finish();
}
