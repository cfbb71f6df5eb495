// smaps text, parsed and every VMA classified and turned into its region record, as the walk does.
#include <cstddef>
#include <cstdint>
#include <string_view>
#include <vector>

#include "platform/RKLinuxVmaClassifier.h"
#include "platform/RKMountInfoParser.h"
#include "platform/RKSmapsParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    std::vector<RKSmapsVma> vmas;
    RKParseSmaps(text, vmas);
    static const RKMountTable mounts = {{RKDeviceKey(0, 40), RKMountKind::Tmpfs},
                                        {RKDeviceKey(0, 41), RKMountKind::Hugetlbfs},
                                        {RKDeviceKey(8, 1), RKMountKind::Other}};
    RKVmaContext context;
    context.pid = 42;
    context.shmemDevice = RKDeviceKey(0, 1);
    context.mounts = &mounts;
    for (const RKSmapsVma& vma : vmas) {
        RKVmaKind kind = RKClassifyVma(vma, context);
        RKRegionInfoForVma(vma, kind, context);
        RKTagForVma(vma, kind, context);
        RKDetailForVma(vma, kind);
    }
    return 0;
}
