// /proc/vmallocinfo text: the kernel's vmalloc areas by caller.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "platform/RKVmallocinfoParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    std::vector<RKVmallocArea> areas;
    RKParseVmallocinfo(text, areas);
    for (const RKVmallocArea& area : areas)
        if (!area.caller.empty() &&
            (area.caller.data() < text.data() || area.caller.data() + area.caller.size() > text.data() + text.size()))
            std::abort();
    return 0;
}
