#include <cerrno>

#include "platform/RKLinuxPlatform.h"

// Placeholder answers until the per-process figures are read from /proc/PID/status.
int RKLinuxPlatform::pidRusage(RKTask&, RKRusageInfo&) { return ENOTSUP; }

int RKLinuxPlatform::ledgerTemplate(std::vector<std::string>& names) {
    names = {"page_table"};
    return 0;
}

int RKLinuxPlatform::ledgerEntries(RKTask&, std::vector<int64_t>&) { return ENOTSUP; }

// First version: no list of owned objects (the kernel interface is absent).
int RKLinuxPlatform::ownedVmObjects(RKTask&, std::vector<RKOwnedVmObjectRecord>&) { return ENOENT; }
