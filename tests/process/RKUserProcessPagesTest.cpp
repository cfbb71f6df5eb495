// Page dispositions of a live process on scripted kernel answers: sizing a region from
// dispositions (holes never asked about, the page it shares with its neighbour), subranges, which
// regions the walk reads page data for, and the shared region's pieces.
#include "RKScriptedToolTest.h"

#include <tuple>

#include "model/RKMemoryRegion.h"
#include "model/RKRangeList.h"

namespace {

constexpr uint64_t P = 4096;
constexpr uint32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT;
constexpr uint32_t kDirty = VM_PAGE_QUERY_PAGE_DIRTY;
constexpr uint32_t kFile = VM_PAGE_QUERY_PAGE_EXTERNAL;
constexpr uint32_t kPagedOut = VM_PAGE_QUERY_PAGE_PAGED_OUT;

std::shared_ptr<RKMemoryRegion> regionOf(uint64_t start, uint64_t end) {
    auto region = std::make_shared<RKMemoryRegion>();
    region->start = start;
    region->setEnd(end);
    return region;
}

class RKUserProcessPagesTest : public RKScriptedToolTest {
protected:
    std::shared_ptr<RKUserProcess> process(bool gather = false, bool breakDown = true) {
        return made(7, breakDown, gather);
    }
    void script(uint64_t address, std::initializer_list<uint32_t> dispositions) {
        for (uint32_t d : dispositions) tool().dispositions[address] = d, address += P;
    }
};

// A terabyte reserved and barely touched (a sanitizer's shadow, a runtime's heap) costs its
// pages: sized and split exactly, with the holes never asked about. Its partial first and last
// pages are charged their bytes; of file pages only the dirty one counts.
TEST_F(RKUserProcessPagesTest, SparseTerabyteCostsItsPagesOnly) {
    const uint64_t base = 0x100000000000, T = 1ull << 40, middle = base + T / 2;
    script(base, {kPresent});
    script(middle, {kPresent, kPagedOut, kPresent | kFile, kPresent | kFile | kDirty});
    script(base + T - P, {kPresent});
    auto tool = process();
    auto region = regionOf(base + 0x800, base + T - 0x800);
    EXPECT_TRUE(tool->_populateMemoryRegionWithPageQueries(*region, {}));
    EXPECT_EQ(region->dirtySize, 0x800 + 2 * P + 0x800);
    EXPECT_EQ(region->swappedSize, P);
    auto next = regionOf(base + T - 0x800, base + T + P);
    EXPECT_TRUE(tool->_populateMemoryRegionWithPageQueries(*next, {}));
    EXPECT_EQ(next->dirtySize, 0x800u) << "the last page from the cache, then a hole";
    EXPECT_EQ(platform->callCount("pageRangeQuery"), 3u) << "one query per stretch of pages, none for the holes";

    auto whole = regionOf(base, base + T);
    tool->_addSubrangesForRegion(*whole, VM_PURGABLE_DENY);
    ASSERT_TRUE(whole->subrangeList());
    EXPECT_EQ(whole->subrangeList()->nodes(), (std::vector<RKRangeListNode>{
                                                  {0, P, P, 0, 0, 0, 0},
                                                  {T / 2, 4 * P, 2 * P, P, P, 0, 0},
                                                  {T - P, P, P, 0, 0, 0, 0},
                                              }));
    EXPECT_EQ(platform->callCount("pageRangeQuery"), 6u);
}

TEST_F(RKUserProcessPagesTest, SubrangesAreRunsOfLikePagesInObjectOffsets) {
    script(0x10000, {kPresent | kDirty, kPresent | kDirty, 0, kPresent});
    auto tool = process();
    auto region = regionOf(0x10000, 0x14000);
    region->offset = 0x100000;
    tool->_addSubrangesForRegion(*region, VM_PURGABLE_DENY);
    ASSERT_TRUE(region->subrangeList());
    EXPECT_EQ(region->subrangeList()->nodes(), (std::vector<RKRangeListNode>{
                                                   {0x100000, 2 * P, 0, 2 * P, 0, 0, 0},
                                                   {0x100000 + 3 * P, P, P, 0, 0, 0, 0},
                                               }));

    // Wired regions are wired in every run.
    auto wired = regionOf(0x10000, 0x14000);
    wired->wired = true;
    tool->_addSubrangesForRegion(*wired, VM_PURGABLE_DENY);
    RKMemoryTotal sum = wired->subrangeList()->sum();
    EXPECT_EQ(std::pair(sum.dirty, sum.wired), std::pair(2 * P, 3 * P));
}

// The shared region of a system that has one (Linux has none; snapshots of such systems reach
// this code) is cut at image segments: a gap takes the segment that ends in its first page, else
// the one that starts in its last, and a page two pieces share counts once. A failed page query
// stops the walk.
TEST_F(RKUserProcessPagesTest, SharedRegionIsCutAtSegmentsAndAPageTwoPiecesShareCountsOnce) {
    constexpr uint64_t base = 0x180000000;  // arm64's
    platform->sharedRegion = true;
    RKScriptedRegion below, mapping;
    below.start = 0x100000, below.size = P;
    mapping.start = base, mapping.size = 0x10 * P, mapping.basic.offset = 0x40000;
    tool().regions = {below, mapping};
    // Unaligned neighbours: data [0x1000, 0x1800), a gap to 0x2400, data [0x2400, 0x3000), a gap,
    // text at 0x4800. Pages 0x1000 and 0x2000 are dirty.
    tool().images = {{"/usr/lib/libA.dylib", base, base + 0x1000, 0x800, "__DATA", 0},
                     {"/usr/lib/libB.dylib", base, base + 0x2400, 0xc00, "__DATA", 0},
                     {"/usr/lib/libC.dylib", base, base + 0x4800, 0x800, "__TEXT", 0}};
    script(base + 0x1000, {kPresent | kDirty, kPresent | kDirty});
    auto pieces = [&] {
        using Piece = std::tuple<uint64_t, uint64_t, std::string, uint8_t, uint64_t>;  // and dirty bytes
        std::vector<Piece> result;
        auto gathered = process(true);
        for (const auto& region : *gathered->memoryRegions()) {
            if (!region->inSharedCache) continue;
            EXPECT_EQ(region->offset, 0x40000 + region->start - base) << "offsets follow the mapping's";
            result.emplace_back(region->start - base, region->end() - base, region->name, region->segment,
                                region->dirtySize);
        }
        return result;
    };
    const std::string unused = "unused lodr shared cache area";
    EXPECT_EQ(pieces(), (std::vector<std::tuple<uint64_t, uint64_t, std::string, uint8_t, uint64_t>>{
                            {0, 0x1000, unused, RKSegmentData, 0},
                            {0x1000, 0x1800, "__DATA", RKSegmentData, 0x800},
                            // 0x800 of page 0x1000 from the cache, 0x400 of page 0x2000 when libB asks
                            {0x1800, 0x2400, unused, RKSegmentData, 0xc00},
                            {0x2400, 0x3000, "__DATA", RKSegmentData, 0xc00},
                            {0x3000, 0x4800, unused, RKSegmentData, 0},
                            {0x4800, 0x5000, "__TEXT", RKSegmentText, 0},
                            {0x5000, 0x10 * P, unused, RKSegmentText, 0}}));

    tool().pageQueryResult = KERN_FAILURE;
    EXPECT_EQ(pieces().size(), 1u) << "the unused area before the first image; the failed piece is dropped";
    EXPECT_NE(printed.find("bailing out for process tool [7]; data may be incomplete!"), std::string::npos) << printed;
}

TEST_F(RKUserProcessPagesTest, ProcessThatExitedBeforeItsPageQuery) {
    tool().pageQueryResult = KERN_INVALID_ARGUMENT;
    tool().shortStatusErrno = ESRCH;
    auto tool = process();
    auto region = regionOf(0x10000, 0x14000);
    testing::internal::CaptureStderr();
    EXPECT_FALSE(tool->_populateMemoryRegionWithPageQueries(*region, {}));
    tool->_addSubrangesForRegion(*region, VM_PURGABLE_DENY);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "mach_vm_page_range_query: process is gone\nmach_vm_page_range_query: process is gone\n");
    EXPECT_EQ(tool->warnings().front(), "tool [7]: process is gone (process exited)");
    EXPECT_FALSE(region->subrangeList()) << "a region only partly read keeps its counters";
}

// The walk reads page data once, after it, for the regions worth splitting only; file
// mappings only where dirty file pages can be told from clean ones.
TEST_F(RKUserProcessPagesTest, PageDataIsReadOnceForEligibleRegions) {
    auto entry = [](uint64_t start, uint8_t shareMode, uint32_t resident, uint32_t dirtied, bool file) {
        RKScriptedRegion region;
        region.start = start;
        region.size = 4 * P;
        region.info = {.pages_resident = resident, .pages_dirtied = dirtied,
                       .external_pager = static_cast<uint8_t>(file), .share_mode = shareMode, .object_id_full = start};
        return region;
    };
    tool().regions = {entry(0x10000, SM_SHARED, 2, 2, false), entry(0x20000, SM_PRIVATE, 2, 2, false),
                      entry(0x30000, SM_SHARED, 4, 4, false), entry(0x40000, SM_SHARED, 3, 1, true)};
    script(0x10000, {kPresent, kPresent});
    script(0x40000, {kPresent | kFile | kDirty, kPresent | kFile, kPresent | kFile});
    auto gathered = process(true);
    ASSERT_EQ(tool().preparedRanges.size(), 2u) << "read once, then released";
    EXPECT_TRUE(tool().preparedRanges[1].empty());
    std::vector<std::pair<uint64_t, bool>> ranges;  // start, file-backed
    for (const auto& range : tool().preparedRanges[0]) ranges.emplace_back(range.start, range.fileBacked);
    EXPECT_EQ(ranges, (std::vector<std::pair<uint64_t, bool>>{{0x10000, false}, {0x40000, true}}))
        << "not the private one, nor the one all dirty";
    EXPECT_EQ((*gathered->memoryRegions())[3]->subrangeList()->sum().dirty, P);

    platform->pageAbilities.dirtyFilePages = false;
    tool().preparedRanges.clear();
    gathered = process(true);
    EXPECT_EQ(tool().preparedRanges[0].size(), 1u) << "the file mapping keeps its counters";
    EXPECT_FALSE((*gathered->memoryRegions())[3]->subrangeList());

    tool().preparedRanges.clear();
    process(true, false);
    EXPECT_TRUE(tool().preparedRanges.empty()) << "no subranges without the breakdown";
}

}  // namespace
