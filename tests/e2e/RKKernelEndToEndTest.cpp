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
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>

#include "support/RKRunCommand.h"

namespace fs = std::filesystem;

namespace {

// "NAME VALUE" lines: the kernel's dirty + reclaimable bytes ("kernel"), its reclaimable bytes,
// its category names ("category:NAME"), and each term of the system map ("system:NAME").
const char* kSummarizeDocument = R"(import json, sys
document = json.load(open(sys.argv[1], encoding="utf-8"))
kernel = next(p for p in document["processes"] if p["pid"] == 0)
print("kernel", sum(c["dirty"] + c["reclaimable"] for c in kernel["categories"].values()))
print("reclaimable", sum(c["reclaimable"] for c in kernel["categories"].values()))
for name in kernel["categories"]: print("category:" + name.replace(" ", "_"), 1)
for name, value in ((document.get("auxiliary") or {}).get("system") or {}).items(): print("system:" + name.replace(" ", "_"), value)
)";

std::map<std::string, int64_t> figures(const RKCommandResult& run, const fs::path& document) {
    RKCommandResult parsed = RKRunCommand({"python3", "-c", kSummarizeDocument, document.string()});
    fs::remove(document);
    EXPECT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_TRUE(parsed.exitedWith(0)) << parsed.standardError;
    std::map<std::string, int64_t> result;
    std::istringstream words(parsed.standardOutput);
    std::string name;
    int64_t value = 0;
    while (words >> name >> value) result[name] = value;
    return result;
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
    const fs::path document = fs::temp_directory_path() / ("rkkernel-" + std::to_string(getpid()) + ".json");
    auto kernelFigure = [](std::map<std::string, int64_t> info) {
        return info["Slab"] + info["KernelStack"] + info["PageTables"] + info["SecPageTables"] + info["Percpu"] +
               info["VmallocUsed"] - std::min(vmallocStacks(), info["KernelStack"]);
    };
    const int64_t before = kernelFigure(meminfo());
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-j", document.string(), "kernel"});
    const int64_t after = kernelFigure(meminfo());
    auto map = figures(run, document);

    const int64_t onePercent = std::max(before, after) / 100;
    expectBetween(map["kernel"], before, after, onePercent, onePercent);
    EXPECT_GT(map["reclaimable"], 0) << "the collectable caches (dentry, inodes) hold reclaimable memory";
    for (const char* name : {"kmalloc_(large)", "KernelStack", "PageTables", "Percpu", "dentry", "Mlocked"})
        EXPECT_TRUE(map.count(std::string("category:") + name)) << name;
    EXPECT_EQ(run.standardError, "");
}

// "unattributed" is what the kernel itself leaves uncounted, give or take 1 % of MemTotal (and
// memspread's own memory), and at most that when the machine is quiet.
TEST(RKKernelEndToEnd, TheSystemMapAccountsForEveryByteOfTheMachine) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    const fs::path document = fs::temp_directory_path() / ("rkkernel-" + std::to_string(getpid()) + ".json");
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
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-a", "-f", "bytes", "-j", document.string()});
    const int64_t own = largestChildResident();
    const int64_t after = uncountedBy(meminfo());
    auto map = figures(run, document);
    // The map adds up to MemTotal exactly.
    int64_t sum = 0;
    for (const char* term : {"free", "processes", "kernel", "page_cache_(not_mapped)", "huge_pages_(free)",
                             "compressed_swap_pool", "unattributed"}) {
        EXPECT_TRUE(map.count(std::string("system:") + term)) << term;
        sum += map[std::string("system:") + term];
    }
    EXPECT_GT(map["system:MemTotal"], 0);
    EXPECT_EQ(sum, map["system:MemTotal"]);
    const int64_t unattributed = map["system:unattributed"];
    const int64_t onePercent = map["system:MemTotal"] / 100;
    expectBetween(unattributed, before, after, onePercent, onePercent + own);
    EXPECT_TRUE(std::max(before, after) >= onePercent / 2 || std::llabs(unattributed) <= onePercent + own)
        << unattributed;
    EXPECT_NE(run.standardOutput.find("\tsystem:\n\t\tMemTotal: "), std::string::npos);
}
