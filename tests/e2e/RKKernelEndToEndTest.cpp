// The kernel process and the system map of the real binary, compared with the kernel's own
// figures read right before and right after the run: /proc/meminfo, and /proc/vmallocinfo for
// the thread stacks that VmallocUsed and KernelStack both count. Other processes (tests run two
// at a time) allocate and free meanwhile: memspread's figure must lie between the two readings,
// give or take 1 %.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <fstream>
#include <map>
#include <string>

#include "support/RKReportRows.h"
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

// Bytes of thread stacks in vmalloc areas.
int64_t vmallocStacks() {
    std::ifstream file("/proc/vmallocinfo");
    int64_t pages = 0;
    for (std::string line; std::getline(file, line);) {
        if (line.find(" kernel_clone+") == std::string::npos && line.find(" fork_idle+") == std::string::npos) continue;
        auto at = line.find(" pages=");
        if (at != std::string::npos) pages += std::stoll(line.substr(at + 7));
    }
    return pages * sysconf(_SC_PAGESIZE);
}

// The largest resident set of a finished child so far: memspread's own memory, which the kernel
// counts as anonymous pages while it runs and which its own map leaves to "unattributed".
int64_t largestChildResident() {
    rusage usage{};
    getrusage(RUSAGE_CHILDREN, &usage);
    return static_cast<int64_t>(usage.ru_maxrss) * 1024;
}

// `value` within `tolerance` of the range of the two readings.
void expectBetween(int64_t value, int64_t before, int64_t after, int64_t below, int64_t above) {
    EXPECT_GE(value, std::min(before, after) - below) << "kernel's figure " << before << " before, " << after << " after";
    EXPECT_LE(value, std::max(before, after) + above) << "kernel's figure " << before << " before, " << after << " after";
}

}  // namespace

TEST(RKKernelEndToEnd, AsRootTheKernelsRegionsAddUpToItsOwnFigures) {
    if (geteuid() != 0) GTEST_SKIP() << "the slab caches and vmalloc callers need root";
    auto kernelFigure = [](std::map<std::string, int64_t> info) {
        return info["Slab"] + info["KernelStack"] + info["PageTables"] + info["SecPageTables"] + info["Percpu"] +
               info["VmallocUsed"] - std::min(vmallocStacks(), info["KernelStack"]);
    };
    const int64_t before = kernelFigure(meminfo());
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "kernel"});
    const int64_t after = kernelFigure(meminfo());
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_EQ(run.standardError, "");
    auto dirty = RKColumnByCategory(run.standardOutput, "kernel [0]: 64-bit");
    auto reclaimable = RKColumnByCategory(run.standardOutput, "kernel [0]: 64-bit", 0, 2);

    const int64_t onePercent = std::max(before, after) / 100;
    expectBetween(static_cast<int64_t>(dirty["TOTAL"] + reclaimable["TOTAL"]), before, after, onePercent, onePercent);
    EXPECT_GT(reclaimable["TOTAL"], 0u) << "the collectable caches (dentry, inodes) hold reclaimable memory";
    for (const char* name : {"kmalloc (large)", "KernelStack", "PageTables", "Percpu", "dentry", "Mlocked"})
        EXPECT_TRUE(dirty.count(name)) << name;
}

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
    // The map adds up to MemTotal exactly.
    int64_t sum = 0;
    for (const char* term : {"free", "processes", "kernel", "page cache (not mapped)", "huge pages (free)",
                             "compressed swap pool", "unattributed"}) {
        EXPECT_TRUE(map.count(term)) << term;
        sum += map[term];
    }
    EXPECT_GT(map["MemTotal"], 0);
    EXPECT_EQ(sum, map["MemTotal"]);
    const int64_t unattributed = map["unattributed"];
    const int64_t onePercent = map["MemTotal"] / 100;
    expectBetween(unattributed, before, after, onePercent, onePercent + own);
    EXPECT_TRUE(std::max(before, after) >= onePercent / 2 || std::llabs(unattributed) <= onePercent + own)
        << unattributed;
}
