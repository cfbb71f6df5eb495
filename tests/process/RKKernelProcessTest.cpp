// The kernel process on scripted kernel-memory records: zone arithmetic, how each kind of site
// the Linux reader makes becomes a region or a counter, and what a refused answer reports.
#include "RKScriptedToolTest.h"

#include <cstring>

#include "model/RKAuxData.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxKernelKinds.h"
#include "process/RKKernelProcess.h"

namespace {

RKZoneName zoneName(const std::string& name) {
    RKZoneName result;
    std::memcpy(result.mzn_name, name.data(), std::min(name.size(), sizeof result.mzn_name));
    return result;
}

RKMemoryInfoRecord siteRecord(uint64_t flags, uint64_t site, uint64_t size, const char* name = "") {
    RKMemoryInfoRecord record;
    record.flags = flags, record.site = site, record.size = size;
    std::strncpy(record.name, name, sizeof record.name);
    return record;
}

class RKKernelProcessTest : public RKScriptedToolTest {
protected:
    std::shared_ptr<RKKernelProcess> gathered() { return made<RKKernelProcess>(0, false); }
    const RKMemoryRegion* named(const RKKernelProcess& process, const std::string& name) {
        for (const auto& region : *process.memoryRegions())
            if (region->name == name) return region.get();
        return nullptr;
    }
};

// The kinds of record the Linux kernel reader makes: slab caches as zones, and sites by tag,
// module, vmalloc caller and meminfo counter.
TEST_F(RKKernelProcessTest, ZonesAndSitesBecomeRegionsAndCountersAuxData) {
    RKKernelMemoryInfo& info = platform->kernelMemory;
    info.zoneNames = {zoneName("dentry"), zoneName("kmalloc (large)")};
    RKZoneInfo plain{.mzi_count = 10, .mzi_cur_size = 16384, .mzi_elem_size = 64}, collectable = plain;
    collectable.mzi_collectable = 1;
    info.zones = {collectable, plain};
    info.modules = {{7, "virtio_net"}};
    const uint64_t wiredTag = VM_KERN_SITE_TAG | VM_KERN_SITE_WIRED;
    RKMemoryInfoRecord counter = siteRecord(VM_KERN_SITE_COUNTER, 1, 0), pageTables = siteRecord(wiredTag, RKKernelTagPageTables, 8192);
    counter.mapped = 5000;
    pageTables.detail = "(note)";
    info.sites = {
        siteRecord(wiredTag, RKKernelTagUserWired, 4096),
        counter,
        siteRecord(VM_KERN_SITE_KMOD | VM_KERN_SITE_WIRED, 7, 100),
        siteRecord(wiredTag, 0, 0),  // nothing at all: skipped
        pageTables,
        siteRecord(VM_KERN_SITE_KERNEL | VM_KERN_SITE_WIRED | VM_KERN_SITE_NAMED, 1, 3, "htab_map_alloc"),
    };

    auto kernel = gathered();
    ASSERT_TRUE(kernel && kernel->memoryRegions());
    const RKRegionList& regions = *kernel->memoryRegions();
    ASSERT_EQ(regions.size(), 6u);
    auto fields = [](const RKMemoryRegion& r) { return std::tuple(r.name, r.dirtySize, r.reclaimableSize); };
    EXPECT_EQ(fields(*regions[0]), std::tuple("dentry", 640u, 15744u)) << "elements in use are dirty, the rest reclaimable";
    EXPECT_EQ(regions[0]->object_id, 0x200000000u);
    EXPECT_EQ(fields(*regions[1]), std::tuple("kmalloc (large)", 16384u, 0u)) << "not collectable: all dirty";

    const RKMemoryRegion* userWired = named(*kernel, "Mlocked");
    ASSERT_TRUE(userWired);
    EXPECT_EQ(userWired->cleanNonSpecSize, 4096u) << "a user process's memory, not the kernel's";
    EXPECT_TRUE(userWired->wired && userWired->detailedName == "(user wired)" && userWired->object_id == 0x100000000u);
    EXPECT_EQ(kernel->counter("MemFree"), 5000) << "counter 1 of the table";
    EXPECT_FALSE(named(*kernel, "MemFree"));
    EXPECT_EQ(named(*kernel, "virtio_net")->dirtySize, 100u);
    EXPECT_EQ(named(*kernel, "PageTables")->detailedName, "(note)");
    EXPECT_EQ(named(*kernel, "htab_map_alloc")->dirtySize, 3u);
    EXPECT_TRUE(kernel->warnings().empty() && kernel->errors().empty());
    // Counters never aggregate across processes.
    EXPECT_FALSE(kernel->auxData()->mergeWithData(nullptr));
}

// Without root the reader leaves out what only root may read, and the report says so once
// rather than showing a kernel that holds no slab memory.
TEST_F(RKKernelProcessTest, ARestrictedAnswerIsShownWithAWarning) {
    platform->kernelMemory.restricted = true;
    auto kernel = gathered();
    ASSERT_TRUE(kernel && kernel->memoryRegions());
    EXPECT_TRUE(kernel->errors().empty());
    EXPECT_EQ(kernel->warnings(),
              std::vector<std::string>{kernel->displayString() +
                                       ": slab caches and vmalloc callers need root; only /proc/meminfo's figures are shown"});
}

TEST_F(RKKernelProcessTest, ARefusedAnswerIsAnError) {
    platform->kernelMemoryResult = KERN_FAILURE;
    auto kernel = gathered();
    ASSERT_TRUE(kernel);
    EXPECT_FALSE(kernel->memoryRegions());
    ASSERT_EQ(kernel->errors().size(), 1u);
    EXPECT_EQ(printed, kernel->displayString() + ": mach_memory_info: " + mach_error_string(KERN_FAILURE) + "\n");
}

}  // namespace
