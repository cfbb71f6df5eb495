#include <cerrno>

#include "platform/RKLinuxPlatform.h"

// Placeholder answers until the /proc process list is read (see the process-list work).
std::optional<std::vector<pid_t>> RKLinuxPlatform::listAllPids() { return std::nullopt; }

std::optional<RKBsdInfo> RKLinuxPlatform::bsdInfo(pid_t) { return std::nullopt; }

int RKLinuxPlatform::shortBsdInfoStatus(pid_t, uint32_t&) { return ESRCH; }

std::optional<std::string> RKLinuxPlatform::executablePath(pid_t) { return std::nullopt; }

uint32_t RKLinuxPlatform::dirtyFlags(pid_t) { return 0; }
