// A process opened through a directory descriptor of /proc/PID. Every later read of the
// process goes through openat() below it, so a pid reused by another process is never read.
#pragma once

#include <string>

#include "platform/RKPlatform.h"
#include "platform/RKUniqueFd.h"

class RKLinuxTask : public RKTask {
public:
    RKLinuxTask(pid_t pid, RKUniqueFd directory) : pid_(pid), directory_(std::move(directory)) {}

    pid_t pid() const override { return pid_; }
    int directoryFd() const { return directory_.get(); }

private:
    pid_t pid_;
    RKUniqueFd directory_;
};
