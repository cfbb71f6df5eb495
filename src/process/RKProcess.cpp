#include "process/RKProcess.h"

#include <cstring>

#include "model/RKAuxData.h"
#include "platform/RKPlatform.h"
#include "platform/RKProcStatParser.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKKernelProcess.h"
#include "process/RKUserProcess.h"

bool RKProcess::initWithBsdInfo(const RKBsdInfo& info) {
    pid_ = info.pbi_pid;
    is64bit_ = (info.pbi_flags & PROC_FLAG_LP64) != 0;
    if (!_populateTask()) return false;
    name_ = _gatherName(info);
    displayString_ = name_ + " [" + std::to_string(pid_) + "]";
    pageSize_ = _gatherPageSize();
    return true;
}

uint64_t RKProcess::_gatherPageSize() { return RKPlatform::current().kernelPageSize(); }

void RKProcess::_addGlobalError(const std::string& error) { globalErrors_.push_back(error); }

bool RKProcess::_populateTask() { return false; }

std::shared_ptr<RKAuxDataMap> RKProcess::auxData() const { return std::make_shared<RKAuxDataMap>(); }

bool RKProcess::breakDownPhysMemspread() const { return RKAnalysisSettings::breakDownPhysMemspread(); }

std::string RKProcess::description() const { return "RKProcess[" + std::to_string(pid_) + "]"; }

std::shared_ptr<RKProcess> RKProcess::processWithBsdInfo(const RKBsdInfo& info) {
    return processWithBsdInfo(info, nullptr);
}

std::shared_ptr<RKProcess> RKProcess::processWithBsdInfo(const RKBsdInfo& info, kern_return_t* taskResult) {
    std::shared_ptr<RKProcess> process;
    if (info.pbi_flags & PROC_FLAG_SYSTEM)
        process = std::make_shared<RKKernelProcess>();
    else
        process = std::make_shared<RKUserProcess>();
    if (!process->initWithBsdInfo(info)) {
        if (taskResult) *taskResult = process->taskResult();
        return nullptr;
    }
    return process;
}

std::shared_ptr<RKProcess> RKProcess::processWithPid(pid_t pid) {
    auto info = RKPlatform::current().bsdInfo(pid);
    if (!info) return nullptr;  // gone, or cannot be inspected
    return processWithBsdInfo(*info);
}

std::string RKProcess::_nameForBsdInfoCommName(const RKBsdInfo& info) {
    // The arrays hold NUL-terminated text; strnlen guards a record filled to the brim.
    if (info.pbi_name[0] != '\0') return std::string(info.pbi_name, strnlen(info.pbi_name, 2 * MAXCOMLEN));
    if (info.pbi_comm[0] != '\0') return std::string(info.pbi_comm, strnlen(info.pbi_comm, MAXCOMLEN));
    return "Unknown";
}

std::string RKProcess::_nameForBsdInfo(const RKBsdInfo& info) {
    return _nameForExecutablePath(RKPlatform::current().executablePath(info.pbi_pid), info);
}

std::string RKProcess::_nameForExecutablePath(const std::optional<std::string>& path, const RKBsdInfo& info) {
    if (path) {
        std::string_view name = RKLastPathComponent(*path);
        if (!name.empty()) return std::string(name);
    }
    return _nameForBsdInfoCommName(info);
}
