// /proc/modules text: loaded kernel modules and their memory.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>
#include <vector>

#include "platform/RKModulesParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    std::vector<RKKernelModule> modules;
    RKParseModules(text, modules);
    for (const RKKernelModule& module : modules)
        if (module.name.data() < text.data() || module.name.data() + module.name.size() > text.data() + text.size())
            std::abort();
    return 0;
}
