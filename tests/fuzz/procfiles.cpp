// The /proc texts memspread reads, as the platform reads them. Every input is each single-file
// format at once: a process's stat line and executable link, status figures, mount table, smaps
// (every VMA classified and made a region record, as the walk does) and dma-buf fdinfo; the SysV
// segment table; the slab caches, vmalloc areas and modules. Split at 0x1e bytes, it is also
// meminfo, slabinfo, vmallocinfo and modules for the kernel's records, where one file's figures
// are subtracted from another's. Names a parser keeps point into the text: one that does not
// would outlive the buffer the platform reads.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "platform/RKLinuxKernelMemory.h"
#include "platform/RKLinuxVmaClassifier.h"
#include "platform/RKModulesParser.h"
#include "platform/RKMountInfoParser.h"
#include "platform/RKOwnedObjectParsers.h"
#include "platform/RKProcStatParser.h"
#include "platform/RKProcStatusFigures.h"
#include "platform/RKSlabinfoParser.h"
#include "platform/RKSmapsParser.h"
#include "platform/RKVmallocinfoParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    auto inText = [&](std::string_view name) {
        if (!name.empty() && (name.data() < text.data() || name.data() + name.size() > text.data() + text.size()))
            std::abort();
    };
    if (auto stat = RKParseProcStat(text)) RKBsdStatusForProcState(stat->state);
    RKIsElf32Header(text);
    RKLastPathComponent(RKExecutablePathFromLink(text, true));
    RKParseStatusFigures(text);
    RKParseMountInfo(text);
    RKParseDmaBufFdinfo(text);
    RKParseSysVShm(text);
    std::vector<RKSlabCache> caches;
    RKParseSlabinfo(text, caches);
    for (const RKSlabCache& cache : caches) inText(cache.name);
    std::vector<RKVmallocArea> areas;
    RKParseVmallocinfo(text, areas);
    for (const RKVmallocArea& area : areas) inText(area.caller);
    std::vector<RKKernelModule> modules;
    RKParseModules(text, modules);
    for (const RKKernelModule& module : modules) inText(module.name);

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

    std::string_view rest = text, parts[4];
    for (std::string_view& part : parts) {
        const size_t end = rest.find('\x1e');
        part = rest.substr(0, end);
        rest = end == std::string_view::npos ? std::string_view() : rest.substr(end + 1);
    }
    RKKernelMemorySources sources;
    sources.meminfo = parts[0];
    sources.slabinfo = parts[1];
    sources.vmallocinfo = parts[2];
    if (!parts[3].empty()) sources.modules = parts[3];
    sources.isReclaimable = [](std::string_view cache) { return cache.size() % 2 == 0; };
    RKKernelMemoryFromSources(sources);
    return 0;
}
