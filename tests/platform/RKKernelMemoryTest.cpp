// From the kernel's memory files to memoryInfo's records, on files captured together on the
// development machine (tests/data/kernel; modules.txt is hand-written: that kernel has no module
// support). The sums are checked against the captured meminfo, recounted here line by line.
#include <gtest/gtest.h>

#include <set>
#include <sstream>
#include <tuple>

#include "platform/RKLinuxKernelKinds.h"
#include "platform/RKLinuxKernelMemory.h"
#include "platform/RKMeminfoParser.h"
#include "platform/RKModulesParser.h"
#include "platform/RKSlabinfoParser.h"
#include "platform/RKVmallocinfoParser.h"
#include "support/RKRunCommand.h"

namespace {

constexpr uint64_t P = 4096;

std::string captured(const char* name) { return RKFileText(std::string(MEMSPREAD_TEST_DATA "/kernel/") + name); }

std::string nameOf(const char (&name)[RK_ZONE_NAME_MAX]) { return std::string(name, strnlen(name, RK_ZONE_NAME_MAX)); }

class RKKernelMemoryTest : public ::testing::Test {
protected:
    RKKernelMemoryTest()
        : meminfo(captured("meminfo.txt")),
          slabinfo(captured("slabinfo.txt")),
          vmallocinfo(captured("vmallocinfo.txt")),
          modules(captured("modules.txt")) {
        std::istringstream flags(captured("reclaim_account.txt"));
        std::string name;
        int flag = 0;
        while (flags >> name >> flag)
            if (flag) reclaimable.insert(name);
        figures = *RKParseMeminfo(meminfo);
    }
    RKKernelMemoryInfo read(bool root, bool withModules) {
        RKKernelMemorySources in;
        in.meminfo = meminfo, in.pageSize = P, in.restricted = !root;
        if (root) {
            in.slabinfo = slabinfo;
            in.vmallocinfo = vmallocinfo;
        }
        if (withModules) in.modules = modules;
        in.isReclaimable = [this](std::string_view cache) { return reclaimable.count(std::string(cache)) != 0; };
        return *RKKernelMemoryFromSources(in);
    }
    // The bytes of the sites that are not counters, user-wired memory excepted, and of the zones.
    static uint64_t kernelBytes(const RKKernelMemoryInfo& info) {
        uint64_t total = 0;
        for (const auto& zone : info.zones) total += zone.mzi_cur_size;
        for (const auto& site : info.sites) {
            bool counter = (site.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_COUNTER;
            bool userWired = (site.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_TAG && site.site == RKKernelTagUserWired;
            if (!counter && !userWired) total += site.size;
        }
        return total;
    }
    const RKMemoryInfoRecord* site(uint64_t type, std::string_view name) const {
        for (const auto& record : answer.sites)
            if ((record.flags & VM_KERN_SITE_TYPE) == type && nameOf(record.name) == name) return &record;
        return nullptr;
    }
    uint64_t figure(const char* name) const { return figures.at(name); }

    std::string meminfo, slabinfo, vmallocinfo, modules;
    std::set<std::string> reclaimable;
    std::map<std::string, uint64_t, std::less<>> figures;
    RKKernelMemoryInfo answer;
};

TEST_F(RKKernelMemoryTest, ParsersReadEveryLineOfTheCapturesAndRefuseWhatIsNotTheirFormat) {
    EXPECT_EQ(figure("MemTotal"), 24684084ull * 1024);
    EXPECT_FALSE(RKParseMeminfo("garbage\n: 12 kB\nName: twelve kB\n"));

    std::vector<RKSlabCache> caches;
    auto slab = RKParseSlabinfo(slabinfo, caches);
    EXPECT_EQ(slab.malformedLines, 0u);
    ASSERT_EQ(caches.size(), 235u);
    caches.clear();
    EXPECT_FALSE(RKParseSlabinfo("slabinfo - version: 3.0\n", caches).knownVersion);
    EXPECT_EQ(RKParseSlabinfo("slabinfo - version: 2.1\nshort 1 2 3\n", caches).malformedLines, 1u);

    std::vector<RKVmallocArea> areas;
    EXPECT_EQ(RKParseVmallocinfo(vmallocinfo, areas), 0u);
    EXPECT_EQ(areas.size(), static_cast<size_t>(std::count(vmallocinfo.begin(), vmallocinfo.end(), '\n')));
    areas.clear();
    RKParseVmallocinfo("0x1-0x2    8192 unpurged vm_area\n"
                       "0x3-0x4   20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4\n"
                       "0x5-0x6    8192 acpi_os_map_iomem+0x1bc/0x1e0 phys=0x000a0000 ioremap\n",
                       areas);
    ASSERT_EQ(areas.size(), 3u);
    EXPECT_EQ(std::tuple(areas[1].caller, areas[1].pages, areas[1].size, areas[2].flags),
              std::tuple("kernel_clone", 4u, 20480u, RKVmallocIoremap))
        << "the guard page is in the size, not in pages=";
    EXPECT_EQ(RKParseVmallocinfo("not an area\n0x1-0x2 big\n", areas), 2u);

    std::vector<RKKernelModule> list;
    EXPECT_EQ(RKParseModules(modules + "broken\nalso 12x 0 - Live\n", list), 2u);
    ASSERT_EQ(list.size(), 5u);
}

TEST_F(RKKernelMemoryTest, AsRootTheRecordsAddUpToTheKernelsOwnFiguresWithStacksOnce) {
    answer = read(true, false);

    // vmalloc'd thread stacks, counted here from the capture itself.
    uint64_t stackPages = 0;
    std::istringstream lines(vmallocinfo);
    for (std::string line; std::getline(lines, line);) {
        auto pages = line.find(" pages=");
        if (line.find(" kernel_clone+") != std::string::npos || line.find(" fork_idle+") != std::string::npos)
            stackPages += std::stoull(line.substr(pages + 7));
    }
    const uint64_t stacksInVmalloc = std::min(stackPages * P, figure("KernelStack"));
    EXPECT_EQ(kernelBytes(answer), figure("Slab") + figure("KernelStack") + figure("PageTables") +
                                       figure("SecPageTables") + figure("Percpu") + figure("VmallocUsed") -
                                       stacksInVmalloc);

    uint64_t slab = 0, collectable = 0;
    for (size_t i = 0; i < answer.zones.size(); ++i) {
        slab += answer.zones[i].mzi_cur_size;
        if (answer.zones[i].mzi_collectable) {
            collectable += answer.zones[i].mzi_cur_size;
            EXPECT_TRUE(reclaimable.count(nameOf(answer.zoneNames[i].mzn_name)));
        }
    }
    EXPECT_EQ(slab, figure("Slab"));
    EXPECT_NEAR(double(collectable), double(figure("SReclaimable")), 0.01 * double(figure("SReclaimable")));
    EXPECT_EQ(nameOf(answer.zoneNames.back().mzn_name), "kmalloc (large)");

    // Thread stacks make no site (they are KernelStack); callers are summed.
    EXPECT_FALSE(site(VM_KERN_SITE_KERNEL, "kernel_clone"));
    const RKMemoryInfoRecord* maps = site(VM_KERN_SITE_KERNEL, "htab_map_alloc");
    ASSERT_TRUE(maps);
    EXPECT_EQ(maps->size, (641u + 577 + 513 + 128 + 128 + 16 + 14 + 2 + 2 + 2) * P);
}

TEST_F(RKKernelMemoryTest, ModulesAreCountedOnceAndWithoutRootOnlyMeminfoIsAnswered) {
    RKKernelMemoryInfo without = read(true, false);
    // The modules' memory as the module allocator's vmalloc areas, also in VmallocUsed.
    const std::vector<uint64_t> moduleSizes = {360448, 73728, 24576, 16384, 12288};
    uint64_t modulePages = 0;
    for (uint64_t size : moduleSizes) {
        const uint64_t pages = (size + P - 1) / P;
        modulePages += pages;
        vmallocinfo += "0x1-0x2 " + std::to_string((pages + 1) * P) + " module_memory_alloc+0x5/0x90 pages=" +
                       std::to_string(pages) + " vmalloc\n";
    }
    const std::string used = "VmallocUsed:       " + std::to_string(figure("VmallocUsed") / 1024);
    meminfo.replace(meminfo.find(used), used.size(),
                    "VmallocUsed:       " + std::to_string(figure("VmallocUsed") / 1024 + modulePages * P / 1024));

    answer = read(true, true);
    EXPECT_EQ(answer.modules.at(3), "net_failover");
    uint64_t modules = 0;
    for (const auto& record : answer.sites)
        if ((record.flags & VM_KERN_SITE_TYPE) == VM_KERN_SITE_KMOD) modules += record.size;
    EXPECT_EQ(modules, 360448u + 73728 + 24576 + 16384 + 12288);
    EXPECT_FALSE(site(VM_KERN_SITE_KERNEL, "module_memory_alloc"));
    EXPECT_EQ(kernelBytes(answer), kernelBytes(without) + modulePages * P)
        << "module memory is vmalloc memory: counted once, under the modules";

    answer = read(false, false);
    ASSERT_EQ(answer.zones.size(), 2u);
    EXPECT_EQ(nameOf(answer.zoneNames[1].mzn_name), "slab (reclaimable)");
    EXPECT_EQ(answer.zones[1].mzi_cur_size, figure("SReclaimable"));
    EXPECT_EQ(kernelBytes(answer),
              figure("Slab") + figure("KernelStack") + figure("PageTables") + figure("SecPageTables") + figure("Percpu"));

    EXPECT_FALSE(RKKernelMemoryFromSources(RKKernelMemorySources{}));
}

}  // namespace
