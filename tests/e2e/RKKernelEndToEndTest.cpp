// The system map of the real binary, compared with /proc/meminfo read right before and right
// after the run. Other processes (tests run two at a time) allocate and free meanwhile:
// memspread's figure must lie between the two readings, give or take 1 %. (The kernel's records
// against its own figures, exactly, are RKKernelMemoryTest's, on captured files.)
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <fstream>
#include <map>
#include <string>

#include "support/RKRunCommand.h"

namespace {

// The terms of the system map that ends a report of every process, by name.
std::map<std::string, int64_t> systemMap(const std::string& report) {
    std::map<std::string, int64_t> terms;
    const auto lines = RKSplitLines(report.substr(std::min(report.find("\n\tsystem:\n"), report.size())));
    for (size_t i = 2; i < lines.size() && lines[i].starts_with("\t\t"); i++) {
        const size_t colon = lines[i].find(": ");
        terms[lines[i].substr(2, colon - 2)] = std::stoll(lines[i].substr(colon + 2));
    }
    return terms;
}

std::map<std::string, int64_t> meminfo() {
    std::map<std::string, int64_t> result;
    std::ifstream file("/proc/meminfo");
    std::string name, rest;
    int64_t kB = 0;
    while (file >> name >> kB && std::getline(file, rest)) result[name.substr(0, name.size() - 1)] = kB * 1024;
    return result;
}

// The largest resident set of a finished child so far: memspread's own memory, which the kernel
// counts as anonymous pages while it runs and which its own map leaves to "unattributed".
int64_t largestChildResident() {
    rusage usage{};
    getrusage(RUSAGE_CHILDREN, &usage);
    return static_cast<int64_t>(usage.ru_maxrss) * 1024;
}

}  // namespace

// "unattributed" is what the kernel itself leaves uncounted, give or take 1 % of MemTotal (and
// memspread's own memory), and at most that when the machine is quiet.
TEST(RKKernelEndToEnd, TheSystemMapAccountsForEveryByteOfTheMachine) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    // What the kernel itself leaves uncounted: MemTotal less free memory and every kind of
    // /proc/meminfo. Little on a quiet machine, hundreds of MiB while compilers come and go.
    auto uncountedBy = [](std::map<std::string, int64_t> info) {
        int64_t uncounted = info["MemTotal"] - info["MemFree"];
        for (const char* kind : {"Buffers", "Cached", "SwapCached", "AnonPages", "Slab", "KernelStack", "PageTables",
                                 "SecPageTables", "Percpu", "VmallocUsed", "Hugetlb", "Zswap"})
            uncounted -= info[kind];
        return uncounted;
    };
    const int64_t before = uncountedBy(meminfo());
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-a", "-f", "bytes"});
    const int64_t own = largestChildResident();
    const int64_t after = uncountedBy(meminfo());
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    auto map = systemMap(run.standardOutput);
    // That the terms add up to MemTotal is RKSystemMemoryTest's; here the remainder against the kernel.
    ASSERT_TRUE(map.count("unattributed") && map["MemTotal"] > 0) << run.standardOutput;
    const int64_t unattributed = map["unattributed"];
    const int64_t onePercent = map["MemTotal"] / 100;
    const std::string figures = "kernel's figure " + std::to_string(before) + " before, " + std::to_string(after) + " after";
    EXPECT_GE(unattributed, std::min(before, after) - onePercent) << figures;
    EXPECT_LE(unattributed, std::max(before, after) + onePercent + own) << figures;
    EXPECT_TRUE(std::max(before, after) >= onePercent / 2 || std::llabs(unattributed) <= onePercent + own)
        << unattributed;
}
