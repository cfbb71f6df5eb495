// The task of a live process: opened when the process is read and closed when that is done, so
// that a run holds descriptors only for the processes being read at the moment, whatever the
// number of processes and the descriptor limit. Every open is checked against the start time of
// the listed process, so a pid reused in between is never read as the listed process.
#include "platform/RKPlatform.h"
#include "process/RKUserProcess.h"

kern_return_t RKUserProcess::_openListedTask() {
    RKPlatform& platform = RKPlatform::current();
    std::unique_ptr<RKTask> task;
    kern_return_t result = platform.taskForPid(pid(), task);
    if (result != KERN_SUCCESS) return result;
    auto current = platform.taskBsdInfo(*task);
    if (!current || current->pbi_start_tvsec != listedStartSeconds_ ||
        current->pbi_start_tvusec != listedStartMicroseconds_)
        return KERN_INVALID_ARGUMENT;  // gone, or the pid now names another process
    setIs64bit((current->pbi_flags & PROC_FLAG_LP64) != 0);
    task_ = std::move(task);
    return KERN_SUCCESS;
}

bool RKUserProcess::_populateTask() {
    taskResult_ = _openListedTask();
    if (taskResult_ != KERN_SUCCESS) {
        mach_error("task_for_pid", taskResult_);
        return false;
    }
    return true;
}

std::string RKUserProcess::_gatherName(const RKBsdInfo& info) {
    if (!task_) return _nameForBsdInfo(info);
    return _nameForExecutablePath(RKPlatform::current().taskExecutablePath(*task_), info);
}

bool RKUserProcess::_reopenTaskForGathering() {
    if (task_) return true;
    taskResult_ = _openListedTask();
    if (taskResult_ == KERN_SUCCESS) return true;
    mach_error("task_for_pid", taskResult_);
    std::string message = displayString() + ": " + mach_error_string(taskResult_);
    if (taskResult_ == KERN_INVALID_ARGUMENT)
        warnings_.push_back(message + " (process exited)");
    else
        errors_.push_back(std::move(message));
    return false;
}
