#include "platform/RKLinuxPlatform.h"

// Placeholder answers until the smaps walk is read.
kern_return_t RKLinuxPlatform::regionRecurse(RKTask&, uint64_t&, uint64_t&, RKRegionSubmapInfo&,
                                             uint32_t&) {
    return KERN_INVALID_ADDRESS;
}

kern_return_t RKLinuxPlatform::region(RKTask&, uint64_t&, uint64_t&, RKRegionBasicInfo&) {
    return KERN_INVALID_ADDRESS;
}

kern_return_t RKLinuxPlatform::purgableState(RKTask&, uint64_t, int& state) {
    state = VM_PURGABLE_DENY;  // Linux has no purgeable memory.
    return KERN_SUCCESS;
}

std::optional<std::string> RKLinuxPlatform::regionFileName(RKTask&, uint64_t) { return std::nullopt; }

kern_return_t RKLinuxPlatform::pageRangeQuery(RKTask&, uint64_t, uint64_t, uint32_t*, uint64_t& count) {
    count = 0;
    return KERN_FAILURE;
}
