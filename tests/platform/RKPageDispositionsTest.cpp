// What Linux says of a page, turned into a disposition: pagemap entries with and without their
// kpageflags word, PAGEMAP_SCAN runs, the LazyFree cap and the frame runs kpageflags is read in.
#include <gtest/gtest.h>

#include "platform/RKKernelTypes.h"
#include "platform/RKPageDispositions.h"

namespace {

constexpr uint32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT;
constexpr uint32_t kDirty = VM_PAGE_QUERY_PAGE_DIRTY;
constexpr uint32_t kFile = VM_PAGE_QUERY_PAGE_EXTERNAL;
constexpr uint32_t kReusable = VM_PAGE_QUERY_PAGE_REUSABLE;
constexpr uint64_t kFrame = 0x12345;

TEST(RKPageDispositions, PagemapEntryWithAndWithoutFlags) {
    const uint64_t anon = RKPagemapPresent | kFrame, filePage = RKPagemapPresent | RKPagemapFilePage | kFrame;
    EXPECT_EQ(RKDispositionForPagemapEntry(anon, false, std::nullopt), kPresent | kDirty);
    EXPECT_EQ(RKDispositionForPagemapEntry(filePage, false, std::nullopt), kPresent | kDirty) << "shmem is memory";
    EXPECT_EQ(RKDispositionForPagemapEntry(filePage, true, std::nullopt), kPresent | kFile) << "dirtiness unknown";
    EXPECT_EQ(RKDispositionForPagemapEntry(filePage, true, RKKpfDirty), kPresent | kFile | kDirty);
    EXPECT_EQ(RKDispositionForPagemapEntry(anon, false, RKKpfZeroPage), 0u) << "the zero page is absent";
    EXPECT_EQ(RKDispositionForPagemapEntry(anon, false, RKKpfAnon), kPresent | kReusable) << "lazily freed";
    EXPECT_EQ(RKDispositionForPagemapEntry(anon, false, RKKpfAnon | RKKpfSwapBacked), kPresent | kDirty);
    EXPECT_EQ(RKDispositionForPagemapEntry(anon, false, RKKpfAnon | RKKpfHuge), kPresent | kDirty);
    EXPECT_EQ(RKDispositionForPagemapEntry(RKPagemapSwapped | 0x2a, false, std::nullopt), VM_PAGE_QUERY_PAGE_PAGED_OUT);
    EXPECT_EQ(RKDispositionForPagemapEntry(0, true, std::nullopt), 0u);

    EXPECT_TRUE(RKPagemapEntryNeedsFlags(anon, false));
    EXPECT_TRUE(RKPagemapEntryNeedsFlags(filePage, true));
    EXPECT_FALSE(RKPagemapEntryNeedsFlags(filePage, false)) << "shmem needs no flags";
    EXPECT_FALSE(RKPagemapEntryNeedsFlags(RKPagemapPresent, false)) << "no frame to look up";
}

TEST(RKPageDispositions, ScanRunCategories) {
    EXPECT_EQ(RKDispositionForScanRun(RKPageIsPresent, true), kPresent | kDirty);
    EXPECT_EQ(RKDispositionForScanRun(RKPageIsPresent | RKPageIsPfnZero, false), 0u) << "the zero page is absent";
    EXPECT_EQ(RKDispositionForScanRun(RKPageIsSwapped, false), uint32_t{VM_PAGE_QUERY_PAGE_PAGED_OUT});
    EXPECT_EQ(RKDispositionForScanRun(RKPageIsPresent | RKPageIsFile, true), kPresent | kFile);
    EXPECT_EQ(RKDispositionForScanRun(RKPageIsPresent | RKPageIsFile, false), kPresent | kDirty) << "shmem is memory";
}

TEST(RKPageDispositions, LazyFreeCapAndPacking) {
    std::vector<uint8_t> pages;
    for (uint32_t d : {kPresent | kReusable, kPresent | kDirty, kPresent | kReusable, kPresent | kReusable})
        pages.push_back(RKPackDisposition(d));
    RKLimitReusablePages(pages, 2);
    std::vector<uint32_t> unpacked;
    for (uint8_t p : pages) unpacked.push_back(RKUnpackDisposition(p));
    EXPECT_EQ(unpacked, (std::vector<uint32_t>{kPresent | kReusable, kPresent | kDirty, kPresent | kReusable, kPresent | kDirty}))
        << "a rewritten lazily freed page keeps its flags; only smaps' count knows";
    for (uint32_t d : {0u, kPresent | kDirty | kFile, kPresent | kReusable, uint32_t{VM_PAGE_QUERY_PAGE_PAGED_OUT}})
        EXPECT_EQ(RKUnpackDisposition(RKPackDisposition(d)), d);
}

TEST(RKPageDispositions, FramesCoalesceIntoBoundedRuns) {
    const uint64_t frames[] = {5, 6, 6, 7, 9, 10, 11, 12, 13, 20};
    auto runs = RKCoalesceFrames(frames, 4);
    std::vector<std::pair<uint64_t, uint64_t>> got;
    for (const auto& run : runs) got.emplace_back(run.first, run.count);
    EXPECT_EQ(got, (std::vector<std::pair<uint64_t, uint64_t>>{{5, 3}, {9, 4}, {13, 1}, {20, 1}}));
}

}  // namespace
