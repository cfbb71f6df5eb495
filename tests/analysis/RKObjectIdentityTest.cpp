// Regions of all processes becoming memory objects, and what each process is charged for them.
#include <gtest/gtest.h>

#include "RKAnalysisTestSupport.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"

namespace {

struct Mode {
    bool breakDown;
    bool sharingDisabled;
    uint64_t memspreadA, memspreadB;  // expected
    bool viewsDiffer;
};

}  // namespace

// A maps [0, 8K) of object 7 dirty; B maps the same pages and 4K more further on. The pages both
// map count once in the summary; each process is charged its own pages with the breakdown on and
// the whole object with it off.
TEST(RKObjectIdentityTest, SharedObjectCountsOnceInSummaryAndAsChargedPerProcess) {
    for (Mode mode : {Mode{true, false, 8192, 12288, true}, Mode{false, false, 12288, 12288, true},
                      Mode{false, true, 12288, 12288, false}}) {
        SCOPED_TRACE(testing::Message() << "breakdown " << mode.breakDown << " sharing off " << mode.sharingDisabled);
        ScopedSettings settings(mode.breakDown, mode.sharingDisabled);
        auto a = makeProcess(10, {region(7, 0, 8192, 8192)});
        auto b = makeProcess(20, {region(7, 0, 8192, 8192), region(7, 16384, 4096, 4096)});
        auto recorder = std::make_shared<RKRecordingFormatter>();
        report(processList(a, b), {recorder});

        auto totals = recorder->callsNamed("printProcessTotal");
        ASSERT_EQ(totals.size(), 2u);
        EXPECT_EQ(totals[0].pid, 20);  // larger memspread first, or larger pid on a tie
        EXPECT_EQ(totals[0].memspread, mode.memspreadB);
        EXPECT_EQ(totals[1].memspread, mode.memspreadA);

        auto shared = recorder->callsNamed("printSharedCategories");
        ASSERT_EQ(shared.size(), 2u);
        EXPECT_EQ(shared[1].pid, 10);
        EXPECT_EQ(shared[1].total.dirty, mode.viewsDiffer ? 8192u : 12288u);
        EXPECT_EQ(shared[1].hasProcessView, mode.viewsDiffer);

        auto summary = recorder->callsNamed("printSummaryCategories");
        ASSERT_EQ(summary.size(), 1u);
        EXPECT_EQ(summary[0].total, (RKMemoryTotal{.dirty = 12288, .regions = 3}));
    }
}

TEST(RKObjectIdentityTest, KeysSeparateWhatMustNotMeet) {
    ScopedSettings settings(false);
    auto cacheData = [](uint64_t objectId, uint64_t dirty) {
        auto made = region(objectId, 0, 4096, dirty, "cache data");
        made->start = 0x180000000;
        made->inSharedCache = true;
        made->segment = RKSegmentData;
        return made;
    };
    auto text = region(77, 0, 4096, 0);
    text->segment = RKSegmentText;
    auto p1 = makeProcess(10, {cacheData(1, 0), text, region(77, 0, 4096, 0), region(0, 0, 4096, 0),
                               region(0, 0, 4096, 0), region(~0ull, 0, 4096, 0)});
    auto p2 = makeProcess(20, {cacheData(2, 0), cacheData(3, 4096)});
    auto p3 = makeProcess(30, {cacheData(4, 4096)});
    auto translated = makeProcess(40, {cacheData(5, 0)});
    translated->setIsTranslated(true);

    RKMemspread memspread(processList(p1, p2, p3, translated));
    memspread.analyzeData();
    auto objectOf = [](const auto& process, size_t i) { return (*process->memoryRegions())[i]->memoryObject(); };
    // Clean shared-cache data is shared by address whatever the object id; dirtied, it is the
    // process's own; a translated process's shared cache is another one.
    EXPECT_EQ(objectOf(p1, 0), objectOf(p2, 0));
    EXPECT_NE(objectOf(p2, 1), objectOf(p2, 0));
    EXPECT_NE(objectOf(p2, 1), objectOf(p3, 0));
    EXPECT_NE(objectOf(translated, 0), objectOf(p1, 0));
    EXPECT_NE(objectOf(p1, 1), objectOf(p1, 2));  // text segment and ordinary mapping of one id
    EXPECT_NE(objectOf(p1, 3), objectOf(p1, 4));  // no object id: one object per region
    EXPECT_EQ(memspread.identityMaps()->uniqueMemoryObjects.size(), 3u);
    EXPECT_EQ(objectOf(p1, 0)->memoryRegions().size(), 2u);
}

// B maps memory that A owns: with the breakdown on B is charged none of its dirty or swapped
// bytes and sees them as clean; the owner is the last claimant.
TEST(RKObjectIdentityTest, OwnedMemoryLooksCleanToOtherMappers) {
    for (bool breakDown : {true, false}) {
        SCOPED_TRACE(breakDown);
        ScopedSettings settings(breakDown);
        auto owned = [](bool claimed) {
            auto made = region(9, 0, 16384, 8192);
            made->swappedSize = 4096;
            made->cleanNonSpecSize = 4096;
            made->share_mode = SM_PRIVATE;
            made->ownedExclusivelyByParentProcess = claimed;
            return made;
        };
        auto a = makeProcess(10, {owned(true)});
        auto b = makeProcess(20, {owned(false)});
        auto recorder = std::make_shared<RKRecordingFormatter>();
        report(processList(a, b), {recorder});

        auto shared = recorder->callsNamed("printSharedCategories");
        ASSERT_EQ(shared.size(), 2u);
        const auto& owner = shared[0].pid == 10 ? shared[0] : shared[1];
        const auto& other = shared[0].pid == 10 ? shared[1] : shared[0];
        EXPECT_EQ(owner.total, (RKMemoryTotal{.dirty = 8192, .swapped = 4096, .clean = 4096, .regions = 2}));
        EXPECT_FALSE(owner.hasProcessView);
        if (breakDown) {
            EXPECT_EQ(other.total, (RKMemoryTotal{.clean = 16384, .regions = 2}));
        } else {
            EXPECT_EQ(other.total, owner.total);
        }
        EXPECT_EQ(other.hasProcessView, breakDown);
    }
    ScopedSettings settings(true);
    RKRegionList claims{region(9, 0, 4096, 4096), region(9, 0, 4096, 4096)};
    for (const auto& claim : claims) claim->ownedExclusivelyByParentProcess = true;
    RKMemspread memspread(processList(makeProcess(10, {claims[0]}), makeProcess(20, {claims[1]})));
    memspread.analyzeData();
    EXPECT_EQ(claims[0]->memoryObject()->ownerPid(), 20);
}

TEST(RKObjectIdentityTest, CategoriesKeyByFullNameUnlessSummarizing) {
    ScopedSettings settings(false);
    for (bool summarize : {false, true}) {
        auto file = [](uint64_t id, const char* path) {
            auto made = region(id, 0, 4096, 4096, "mapped file");
            made->detailedName = path;
            return made;
        };
        auto recorder = std::make_shared<RKRecordingFormatter>();
        report(processList(makeProcess(10, {file(1, "/a"), file(2, "/b")})), {recorder}, false, summarize);
        auto table = recorder->callsNamed("printProcessCategories")[0].categories;
        ASSERT_EQ(table.size(), summarize ? 1u : 2u);
        EXPECT_EQ(table.begin()->second->totalDirtySize(), summarize ? 8192u : 4096u);
    }
}
