// The shared region cut at image segments, on scripted answers: gaps and their segments, the
// alignment rule, which pieces are sized from page dispositions and how a page shared by two
// pieces is counted once; and snapshots of other platforms, whose shared-region pieces carry
// their sizes in bytes.
#include <gtest/gtest.h>

#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKVmsnapProcess.h"

namespace {

constexpr uint64_t kBase = 0x180000000;  // arm64's shared region
constexpr uint64_t P = 4096;
constexpr uint32_t kDirty = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;

class RKSharedRegionTest : public ::testing::Test {
protected:
    RKSharedRegionTest() {
        platform->sharedRegion = true;
        RKScriptedProcess& process = platform->addProcess(7, "tool");
        RKScriptedRegion below;
        below.start = 0x100000;
        below.size = P;
        process.regions.push_back(below);
        RKScriptedRegion mapping;
        mapping.start = kBase;
        mapping.size = 0x10 * P;
        mapping.basic.offset = 0x40000;
        process.regions.push_back(mapping);
    }
    ~RKSharedRegionTest() override { RKAnalysisSettings::resetCache(); }

    void addImage(uint64_t start, uint64_t size, const char* name, const char* path = "/usr/lib/libA.dylib") {
        platform->find(7)->images.push_back({path, kBase, start, size, name, 0});
    }
    // The regions made of the shared mapping, and what was printed.
    RKRegionList pieces() {
        testing::internal::CaptureStderr();
        auto process = RKProcess::processWithPid(7);
        process->gatherData();
        printed = testing::internal::GetCapturedStderr();
        RKRegionList result;
        for (const auto& region : *process->memoryRegions())
            if (region->inSharedCache) result.push_back(region);
        return result;
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scoped{platform};
    std::string printed;
};

struct Expected {
    uint64_t start, end;
    const char* name;
    uint8_t segment;
    uint64_t dirty;
};

void expectPieces(const RKRegionList& pieces, const std::vector<Expected>& expected) {
    ASSERT_EQ(pieces.size(), expected.size());
    for (size_t i = 0; i < expected.size(); i++) {
        SCOPED_TRACE(i);
        EXPECT_EQ(pieces[i]->start, expected[i].start);
        EXPECT_EQ(pieces[i]->end(), expected[i].end);
        EXPECT_EQ(pieces[i]->name, expected[i].name);
        EXPECT_EQ(pieces[i]->segment, expected[i].segment);
        EXPECT_EQ(pieces[i]->dirtySize, expected[i].dirty);
        EXPECT_EQ(pieces[i]->offset, 0x40000 + pieces[i]->start - kBase) << "offsets follow the mapping's";
    }
}

}  // namespace

TEST_F(RKSharedRegionTest, MappingWithoutImagesIsOneUnusedArea) {
    expectPieces(pieces(), {{kBase, kBase + 0x10 * P, "unused lodr shared cache area", RKSegmentUnset, 0}});
    EXPECT_EQ(platform->callCount("pageRangeQuery"), 0u) << "an aligned unused area is not queried";
}

TEST_F(RKSharedRegionTest, AlignedSegmentsOwnTheirLastBlockAndOnlyDataIsQueried) {
    // Text ends 0x100 past a block; the next image starts at the next block: no gap between.
    addImage(kBase, 2 * P + 0x100, "__TEXT");
    addImage(kBase + 3 * P, 2 * P, "__DATA_CONST", "/usr/lib/libB.dylib");
    addImage(kBase + 5 * P, 2 * P, "__LINKEDIT", "/usr/lib/libB.dylib");
    platform->find(7)->dispositions = {{kBase + 3 * P, kDirty}, {kBase + 4 * P, VM_PAGE_QUERY_PAGE_PAGED_OUT}};
    auto list = pieces();
    expectPieces(list, {{kBase, kBase + 3 * P, "__TEXT", RKSegmentText, 0},
                        {kBase + 3 * P, kBase + 5 * P, "__DATA_CONST", RKSegmentData, P},
                        {kBase + 5 * P, kBase + 7 * P, "__LINKEDIT", RKSegmentLinkedit, 0},
                        // a gap after a segment shares the page where that segment ends
                        {kBase + 7 * P, kBase + 0x10 * P, "unused lodr shared cache area", RKSegmentLinkedit, 0}});
    EXPECT_EQ(list[1]->swappedSize, P);
    EXPECT_EQ(list[0]->detailedName, "/usr/lib/libA.dylib");
    EXPECT_EQ(list[2]->detailedName, "lodr shared cache");
    EXPECT_EQ(platform->callCount("pageRangeQuery"), 1u) << "text and link-edit are never queried";
}

TEST_F(RKSharedRegionTest, GapsTakeTheSegmentOfTheirPageAndSharedPagesCountOnce) {
    // Unaligned neighbours: data [0x1000, 0x1800), a gap to 0x2400, data [0x2400, 0x3000), a gap,
    // text at 0x4800. Pages 0x1000 and 0x2000 are dirty. A gap takes the segment that ends in its
    // first page, else the one that starts in its last.
    addImage(kBase + 0x1000, 0x800, "__DATA");
    addImage(kBase + 0x2400, 0xc00, "__DATA", "/usr/lib/libB.dylib");
    addImage(kBase + 0x4800, 0x800, "__TEXT", "/usr/lib/libC.dylib");
    platform->find(7)->dispositions = {{kBase + 0x1000, kDirty}, {kBase + 0x2000, kDirty}};
    auto list = pieces();
    const char* unused = "unused lodr shared cache area";
    expectPieces(list, {{kBase, kBase + 0x1000, unused, RKSegmentData, 0},
                        {kBase + 0x1000, kBase + 0x1800, "__DATA", RKSegmentData, 0x800},
                        // 0x800 of page 0x1000 from the cache, 0x400 of page 0x2000 when libB asks
                        {kBase + 0x1800, kBase + 0x2400, unused, RKSegmentData, 0xc00},
                        {kBase + 0x2400, kBase + 0x3000, "__DATA", RKSegmentData, 0xc00},
                        {kBase + 0x3000, kBase + 0x4800, unused, RKSegmentData, 0},
                        {kBase + 0x4800, kBase + 0x5000, "__TEXT", RKSegmentText, 0},
                        {kBase + 0x5000, kBase + 0x10 * P, unused, RKSegmentText, 0}});
    uint64_t dirty = 0;
    for (const auto& region : list) dirty += region->dirtySize;
    EXPECT_EQ(dirty, 2 * P) << "two dirty pages, each counted once";
}

TEST_F(RKSharedRegionTest, FailedPageQueryStopsTheWalk) {
    addImage(kBase + P, P, "__DATA");
    platform->find(7)->pageQueryResult = KERN_FAILURE;
    auto list = pieces();
    EXPECT_EQ(list.size(), 1u) << "the unused area before it; the failed piece is dropped";
    EXPECT_NE(printed.find("bailing out for process tool [7]; data may be incomplete!"), std::string::npos) << printed;
}

TEST_F(RKSharedRegionTest, SnapshotPiecesOfTheSharedRegionCarryBytes) {
    const std::string regions = R"J([
        {"address":6442450944,"length":16384,"type":"__TEXT","path":"/usr/lib/libA.dylib","resident_size":16384},
        {"address":6442467328,"length":16384,"type":"__DATA","path":"/usr/lib/libA.dylib","dirty_size":8192,
         "swapped_out_size":4096,"resident_size":16384},
        {"address":6442483712,"length":16384,"type":"__LINKEDIT","path":"/usr/lib/libA.dylib"}])J";
    RKVmsnapProcess process;
    RKError error;
    ASSERT_TRUE(process.initWithVmsnapData(
        R"({"format":"memspread-vmsnap","version":1,"pid":3,"processName":"app","vmPageSize":16384,)"
        R"("processDescription":"iOS ARM64","regions":)" + regions + "}", &error))
        << error.localizedDescription.value_or("");
    process.gatherData();
    const auto& list = *process.memoryRegions();
    ASSERT_EQ(list.size(), 3u);
    EXPECT_EQ(list[0]->name, "__TEXT");
    EXPECT_EQ(list[0]->dirtySize, 0u);
    EXPECT_EQ(list[1]->name, "__DATA");
    EXPECT_EQ(list[1]->dirtySize, 8192u) << "bytes, not pages";
    EXPECT_EQ(list[1]->swappedSize, 4096u);
    EXPECT_EQ(list[2]->detailedName, "lodr shared cache");
    EXPECT_TRUE(list[2]->inSharedCache);
}
