// The /proc texts whose parsers read one file each: a process's stat line and executable link,
// its status figures, mount table and dma-buf fdinfo; the SysV segment table; the slab caches,
// vmalloc areas and modules. Every parser reads every input: the seeds of each format reach the
// others too. Names a parser keeps point into the text: one that does not would outlive the
// buffer the platform reads.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "platform/RKModulesParser.h"
#include "platform/RKMountInfoParser.h"
#include "platform/RKOwnedObjectParsers.h"
#include "platform/RKProcStatParser.h"
#include "platform/RKProcStatusFigures.h"
#include "platform/RKSlabinfoParser.h"
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
    return 0;
}
