// Parsing smaps text: the one parse every gathered mapping goes through. The text is built in
// the kernel's layout (kernel 6.x field set), anonymous mappings with a file mapping among them.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <string>
#include <vector>

#include "platform/RKSmapsParser.h"

namespace {

const char* const kFields[] = {
    "Size",          "KernelPageSize", "MMUPageSize",    "Rss",           "Pss",            "Pss_Dirty",
    "Shared_Clean",  "Shared_Dirty",   "Private_Clean",  "Private_Dirty", "Referenced",     "Anonymous",
    "KSM",           "LazyFree",       "AnonHugePages",  "ShmemPmdMapped", "FilePmdMapped", "Shared_Hugetlb",
    "Private_Hugetlb", "Swap",         "SwapPss",        "Locked",
};

std::string smapsText(int64_t count) {
    std::string text;
    char line[160];
    uint64_t address = 0x7f0000000000;
    for (int64_t i = 0; i < count; i++) {
        const bool file = i % 50 == 0;
        std::snprintf(line, sizeof line, "%lx-%lx %s %08x %s %-26s%s\n", static_cast<unsigned long>(address),
                      static_cast<unsigned long>(address + 0x10000), file ? "r--p" : "rw-p", file ? 0x1000 : 0,
                      file ? "fe:00 10952943" : "00:00 0", "", file ? "/usr/lib/x86_64-linux-gnu/libc.so.6" : "");
        text += line;
        for (const char* field : kFields) {
            std::snprintf(line, sizeof line, "%-16s%8d kB\n", (std::string(field) + ":").c_str(), i % 3 ? 64 : 0);
            text += line;
        }
        text += "THPeligible:    0\nVmFlags: rd wr mr mw me ac \n";
        address += 0x11000;
    }
    return text;
}

void parseSmaps(benchmark::State& state) {
    const std::string text = smapsText(state.range(0));
    std::vector<RKSmapsVma> vmas;
    for (auto _ : state) {
        vmas.clear();
        RKParseSmaps(text, vmas);
        benchmark::DoNotOptimize(vmas.data());
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
    state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(text.size()));
}
BENCHMARK(parseSmaps)->Arg(1000)->Arg(60000);

}  // namespace
