// The kernel's memory records built from meminfo, slabinfo, vmallocinfo and modules at once,
// where one file's figures are subtracted from another's. The input holds the four texts
// separated by 0x1e bytes; the seed joins the captured files so.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/RKLinuxKernelMemory.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view rest(reinterpret_cast<const char*>(data), size);
    std::string_view parts[4];
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
