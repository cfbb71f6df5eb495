// A process of the system list that could not be opened (no permission, no descriptor left):
// it is never measured and never shown as a process, but its one warning (name, pid and why)
// reaches the report, so that measuring all processes never drops one silently. A process that
// exited before it could be opened gets none: it is no longer part of the system.
#pragma once

#include <memory>

#include "process/RKProcess.h"

class RKUnreadProcess : public RKProcess {
public:
    // Nothing for a process that is gone; otherwise the process with its warning.
    static std::shared_ptr<RKUnreadProcess> processForFailure(const RKBsdInfo& info, kern_return_t taskResult);
};
