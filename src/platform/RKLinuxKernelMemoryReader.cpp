// mach_memory_info on Linux: /proc/meminfo (anyone may read it), /proc/slabinfo and
// /proc/vmallocinfo (root only), /proc/modules and each slab cache's reclaim_account in
// /sys/kernel/slab. Each file is read once, whole.
#include <fcntl.h>

#include <cerrno>
#include <string>

#include "platform/RKLinuxKernelMemory.h"
#include "platform/RKLinuxPlatform.h"
#include "platform/RKProcFile.h"

namespace {

bool refused(int error) { return error == EACCES || error == EPERM; }

}  // namespace

kern_return_t RKLinuxPlatform::memoryInfo(RKKernelMemoryInfo& info) {
    std::string meminfo, slabinfo, vmallocinfo, modules;
    if (int error = RKReadFileAt(AT_FDCWD, (procRoot_ + "/meminfo").c_str(), meminfo)) {
        return refused(error) ? KERN_PROTECTION_FAILURE : KERN_FAILURE;
    }
    RKKernelMemorySources sources;
    sources.meminfo = meminfo;
    sources.pageSize = kernelPageSize();
    int error = RKReadFileAt(AT_FDCWD, (procRoot_ + "/slabinfo").c_str(), slabinfo);
    if (error == 0) sources.slabinfo = slabinfo;
    sources.restricted |= refused(error);
    error = RKReadFileAt(AT_FDCWD, (procRoot_ + "/vmallocinfo").c_str(), vmallocinfo);
    if (error == 0) sources.vmallocinfo = vmallocinfo;
    sources.restricted |= refused(error);
    // A kernel built without module support has no /proc/modules.
    if (RKReadFileAt(AT_FDCWD, (procRoot_ + "/modules").c_str(), modules) == 0) sources.modules = modules;

    std::string flag;
    const std::string slabRoot = sysRoot_ + "/kernel/slab/";
    sources.isReclaimable = [&](std::string_view cache) {
        std::string path = slabRoot;
        path.append(cache).append("/reclaim_account");
        return RKReadFileAt(AT_FDCWD, path.c_str(), flag) == 0 && !flag.empty() && flag[0] == '1';
    };
    auto answer = RKKernelMemoryFromSources(sources);
    if (!answer) return KERN_FAILURE;
    info = std::move(*answer);
    return KERN_SUCCESS;
}
