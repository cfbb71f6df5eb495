#include "model/RKMemoryRegion.h"

#include <gtest/gtest.h>

#include <set>

#include "RKModelTestSupport.h"
#include "platform/RKLinuxTags.h"

TEST(RKMemoryRegion, DerivedValuesAndOrder) {
    RKMemoryRegion unmapped, named, larger;
    unmapped.start = RKRegionNoAddress;
    unmapped.size = 4096;
    EXPECT_EQ(unmapped.end(), RKRegionNoAddress);  // no wrap-around to 4095

    named.name = "mapped file";
    EXPECT_EQ(named.fullName(), "mapped file");
    named.detailedName = "/usr/lib/libc.so.6";
    EXPECT_EQ(named.fullName(), "mapped file /usr/lib/libc.so.6");

    named.start = larger.start = 0x1000;
    named.setEnd(0x3000);
    larger.size = 0x5000;
    EXPECT_EQ(named.size, 0x2000u);
    EXPECT_EQ(larger.compare(named), -1);  // same start: the larger first
    EXPECT_EQ(named.compare(larger), 1);
    EXPECT_EQ(unmapped.compare(named), 1);
    EXPECT_EQ(named.compare(named), 0);
    EXPECT_DEATH(named.setEnd(0xfff), "end >= self.start");
}

TEST(RKMemoryRegion, EligibilityForProcessViewsAndSubranges) {
    auto eligible = [](auto&& change) {
        auto region = makeRegion(1, 0, 4 * kPage, {.dirty = kPage, .clean = kPage});
        change(*region);
        return std::pair{region->eligibleForProcessView(), region->eligibleForSubrangesUsingPageSize(kPage)};
    };
    using Both = std::pair<bool, bool>;
    EXPECT_EQ(eligible([](auto&) {}), Both(true, true));
    for (uint8_t mode : {SM_PRIVATE, SM_EMPTY, SM_PRIVATE_ALIASED})
        EXPECT_EQ(eligible([&](auto& r) { r.share_mode = mode; }), Both(false, false)) << int(mode);
    EXPECT_EQ(eligible([](auto& r) { r.share_mode = SM_SHARED_ALIASED; }), Both(true, true));
    for (uint8_t segment : {RKSegmentText, RKSegmentData, RKSegmentLinkedit})
        EXPECT_EQ(eligible([&](auto& r) { r.segment = segment; }), Both(false, false)) << int(segment);
    EXPECT_EQ(eligible([](auto& r) { r.inSharedCache = true; }), Both(false, false));
    EXPECT_EQ(eligible([](auto& r) { r.user_tag = RKFakeRegionTag; }), Both(false, false));
    // Not worth splitting: wholly in one state, nothing counted, one page, owned.
    EXPECT_EQ(eligible([](auto& r) { r.dirtySize = r.size; }), Both(true, false));
    EXPECT_EQ(eligible([](auto& r) { r.reclaimableSize = r.size; }), Both(true, false));
    EXPECT_EQ(eligible([](auto& r) { r.dirtySize = r.cleanNonSpecSize = 0; }), Both(true, false));
    EXPECT_EQ(eligible([](auto& r) { r.size = kPage; }), Both(true, false));
    EXPECT_EQ(eligible([](auto& r) { r.ownedExclusivelyByParentProcess = true; }), Both(true, false));
}

TEST(RKMemoryRegion, NamesOfTags) {
    EXPECT_EQ(RKMemoryRegion::categoryNameForTag(240), "app-specific tag 1");
    EXPECT_EQ(RKMemoryRegion::categoryNameForTag(255), "app-specific tag 16");
    EXPECT_EQ(RKMemoryRegion::categoryNameForTag(2), "tag 2");  // no Linux mapping carries it
    EXPECT_EQ(RKMemoryRegion::categoryNameForTag(256), "tag 256");
    EXPECT_EQ(RKMemoryRegion::categoryNameForTag(0xFFFFFFFE), "tag -2");
    EXPECT_EQ(RKMemoryRegion::categoryNameForTag(0xFFFFFFFF), "Owned physical memspread (unmapped)");
    EXPECT_EQ(RKMemoryRegion::vmLedgerNameForTag(1), std::nullopt);
    EXPECT_EQ(RKMemoryRegion::vmLedgerNameForTag(2), "network");
    EXPECT_EQ(RKMemoryRegion::vmLedgerNameForTag(5), "neural");
    EXPECT_EQ(RKMemoryRegion::vmLedgerNameForTag(6), "VM ledger tag 6");
}

// Reports show these names for this platform's tags: a renumbered tag keeps its name, and no
// name exists without a tag number or twice.
TEST(RKMemoryRegion, LinuxTagNamesStayInStepWithTheTagNumbers) {
    const std::pair<RKLinuxTag, const char*> expected[] = {
        {RKTagAnonymous, "anonymous"}, {RKTagHeap, "heap"}, {RKTagStack, "stack"},
        {RKTagSysVShm, "SysV shared memory"}, {RKTagMemfd, "memfd"}, {RKTagSharedAnonymous, "shared anonymous"},
        {RKTagPosixShm, "POSIX shared memory"}, {RKTagHugetlb, "hugetlb"}, {RKTagVdso, "vdso"},
        {RKTagVvar, "vvar"}, {RKTagVsyscall, "vsyscall"}, {RKTagUprobes, "uprobes"},
        {RKTagDevice, "device"}, {RKTagKernelObject, "kernel object"},
    };
    for (const auto& [tag, name] : expected) EXPECT_EQ(RKMemoryRegion::categoryNameForTag(tag), name) << tag;
    std::set<std::string> named;
    for (uint32_t tag = 0; tag < 240; ++tag) {
        std::string name = RKMemoryRegion::categoryNameForTag(tag);
        if (name == "tag " + std::to_string(tag)) continue;
        EXPECT_TRUE(named.insert(name).second) << name;
    }
    EXPECT_EQ(named.size(), std::size(expected));
}
