// /proc/modules as plain records: "name size refcount deps state address [taints]".
#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

struct RKKernelModule {
    std::string_view name;  // points into the parsed text
    uint64_t size = 0;      // bytes of module memory (text, data, read-only data)
};

// Appends the modules of `text` to `modules`, in file order; returns the malformed line count.
size_t RKParseModules(std::string_view text, std::vector<RKKernelModule>& modules);
