// /proc/slabinfo text: the kernel's slab caches.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "platform/RKSlabinfoParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    std::vector<RKSlabCache> caches;
    RKParseSlabinfo(text, caches);
    // Names point into the text: one that does not would outlive the buffer the platform reads.
    for (const RKSlabCache& cache : caches)
        if (cache.name.data() < text.data() || cache.name.data() + cache.name.size() > text.data() + text.size()) std::abort();
    return 0;
}
