// /proc/vmallocinfo as plain records, one per area:
// "0xSTART-0xEND SIZE CALLER+0xOFF/0xLEN [pages=N] [phys=ADDR] [ioremap] [vmalloc] [vmap] ...".
// SIZE includes a guard page; `pages=` is what the area holds. Lines without a caller
// ("unpurged vm_area", areas of the vmap block allocator) have an empty caller.
#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

enum RKVmallocFlag : uint32_t {
    RKVmallocIoremap = 1u << 0,  // device memory, not RAM
    RKVmallocVmap = 1u << 1,     // pages that belong to someone else, mapped here
    RKVmallocVmalloc = 1u << 2,
    RKVmallocUser = 1u << 3,
    RKVmallocVpages = 1u << 4,   // the page array itself was vmalloc'd
};

struct RKVmallocArea {
    std::string_view caller;  // the function, without "+offset/length"; points into the text
    uint64_t size = 0;        // bytes, guard page included
    uint64_t pages = 0;       // pages= (0 when absent)
    uint32_t flags = 0;       // RKVmallocFlag bits
};

// Appends the areas of `text` to `areas`; returns the number of lines that could not be read.
size_t RKParseVmallocinfo(std::string_view text, std::vector<RKVmallocArea>& areas);
