// Images: the forward-only enumerator the walk names regions with, the intern tables shared by
// gathering threads, and the images of a process on scripted answers naming its regions.
#include <gtest/gtest.h>

#include <thread>

#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKImage.h"
#include "process/RKUserProcess.h"

namespace {

std::shared_ptr<RKImage> image(uint64_t start, uint64_t size) {
    auto result = std::make_shared<RKImage>();
    result->start = start;
    result->size = size;
    return result;
}

}  // namespace

TEST(RKImage, EnumeratorOnlyMovesForwardAndSeesAppendedImages) {
    RKImageList images{image(0x1000, 0x1000), image(0x3000, 0x2000)};
    RKImageEnumerator enumerator(images);
    EXPECT_EQ(enumerator.nextImageForStart(0x0, 0x800), nullptr);         // before the first
    EXPECT_EQ(enumerator.nextImageForStart(0x1800, 0x2000), images[0]);   // start inside
    EXPECT_EQ(enumerator.nextImageForStart(0x2000, 0x3000), nullptr);     // the gap: first passed
    EXPECT_EQ(enumerator.nextImageForStart(0x2800, 0x3800), images[1]);   // end inside
    EXPECT_EQ(enumerator.nextImageForStart(0x2000, 0x6000), images[1]);   // image inside the range
    EXPECT_EQ(enumerator.nextImageForStart(0x5000, 0x6000), nullptr);     // never one that ended
    images.push_back(image(0x7000, 0x1000));
    EXPECT_EQ(enumerator.nextImageForStart(0x7000, 0x8000), images[2]);
    EXPECT_EQ(enumerator.nextImageForStart(0x1000, 0x2000), nullptr) << "an image passed is not found again";
}

TEST(RKImage, InternTablesShareOneStringAcrossThreadsAndOverflowToOwnCopies) {
    RKStringInternTable<4> table;
    std::vector<RKSharedString> seen(8);
    std::vector<std::thread> threads;
    for (size_t i = 0; i < seen.size(); i++)
        threads.emplace_back([&, i] { seen[i] = table.intern("/usr/lib/libsystem.dylib", 2, 4, 1024); });
    for (auto& thread : threads) thread.join();
    for (const auto& string : seen) EXPECT_EQ(string.get(), seen[0].get()) << "one object for equal strings";
    EXPECT_EQ(table.filledCount(), 1u);
    for (const char* name : {"b", "c", "d"}) table.intern(name, 0, 4, 1024);
    EXPECT_EQ(table.filledCount(), 4u);
    auto overflow = table.intern("e", 0, 4, 1024);
    EXPECT_EQ(*overflow, "e");
    EXPECT_NE(overflow.get(), table.intern("e", 0, 4, 1024).get()) << "a full table hands out copies";
    EXPECT_EQ(*table.intern("bx", 0, 4, 1), "b") << "compared on the first `limit` bytes only";
}

TEST(RKImage, ImagesOfAProcessNameItsRegions) {
    auto platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scoped(platform);
    auto& tool = platform->addProcess(7, "tool");
    RKRegionSubmapInfo file;
    file.external_pager = 1;
    for (uint64_t start : {0x10000, 0x12000, 0x14000, 0x20000})
        tool.regions.push_back({start, 0x2000, file, RK_REGION_SUBMAP_INFO_COUNT, VM_PURGABLE_DENY, "/bin/tool", {}});
    // Out of order, as the Linux platform makes them: named after what each mapping holds.
    tool.images = {
        {"/bin/tool", 0x10000, 0x14000, 0x2000, ".data", RKSegmentData},
        {"/bin/tool", 0x10000, 0x10000, 0x2000, ".text", RKSegmentText},
        {"/bin/tool", 0x10000, 0x12000, 0x2000, ".rodata", RKSegmentLinkedit},
    };
    auto process = std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(7));
    ASSERT_TRUE(process);
    process->gatherData();
    const auto& regions = *process->memoryRegions();
    ASSERT_EQ(regions.size(), 4u);
    const std::pair<const char*, uint8_t> expected[] = {
        {".text", RKSegmentText}, {".rodata", RKSegmentLinkedit}, {".data", RKSegmentData},
        {"mapped file", RKSegmentNoImage},  // a mapping of no image segment
    };
    for (size_t i = 0; i < regions.size(); i++) {
        EXPECT_EQ(regions[i]->name, expected[i].first) << i;
        EXPECT_EQ(regions[i]->segment, expected[i].second) << i;
        EXPECT_EQ(regions[i]->detailedName, "/bin/tool") << i;
    }
    EXPECT_FALSE(process->images()) << "images are dropped after the walk";
    RKAnalysisSettings::resetCache();
}
