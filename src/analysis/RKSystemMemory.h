// The machine's memory accounted for, when a run measures every process: MemTotal and the terms
// that make it up, each byte in one term, ending in "unattributed", the rest. docs/linux.md
// ("The system map") defines every term.
#pragma once

#include <cstddef>
#include <memory>

#include "output/RKOutputFormatter.h"

class RKAuxDataMap;

struct RKSystemMemory {
    std::shared_ptr<RKAuxDataMap> map;  // null when the kernel's figures are missing
    size_t unreadableProcesses = 0;     // user processes whose memory is in "unattributed"
};

// From the analysed processes (their memory objects resolved): the kernel process's counters
// and regions, and every user process's memory counted once. `breakDown` is whether user
// processes were charged their page tables.
RKSystemMemory RKAccountForSystemMemory(const RKProcessList& processes, bool breakDown);
