#include "process/RKUnreadProcess.h"

#include "platform/RKPlatform.h"

std::shared_ptr<RKUnreadProcess> RKUnreadProcess::processForFailure(const RKBsdInfo& info,
                                                                    kern_return_t taskResult) {
    if (taskResult == KERN_INVALID_ARGUMENT || taskResult == MACH_SEND_INVALID_DEST) return nullptr;
    auto process = std::make_shared<RKUnreadProcess>();
    process->setPid(info.pbi_pid);
    // The listed name: the pid could name another process by now, so nothing is read again.
    process->setName(_nameForBsdInfoCommName(info));
    process->setDisplayString(process->name() + " [" + std::to_string(info.pbi_pid) + "]");
    process->setHiddenFromDisplay(true);
    process->warnings_.push_back(process->displayString() + ": not measured - " + mach_error_string(taskResult));
    return process;
}
