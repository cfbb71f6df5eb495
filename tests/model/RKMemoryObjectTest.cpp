// Memory objects and the regions that map them. (Groups of the processes that share them, found
// by member set, are in the analysis tests' golden journals.)
#include "model/RKMemoryObject.h"

#include <gtest/gtest.h>

#include <array>
#include <vector>

#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"

namespace {

constexpr uint64_t kPage = 4096;

std::shared_ptr<RKProcess> makeProcess(pid_t pid) {
    auto process = std::make_shared<RKProcess>();
    process->setPid(pid);
    process->setPageSize(kPage);
    return process;
}

struct RegionSizes {
    uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0;
    bool wired = false;
};

// A shared mapping (eligible for per-process views) of the first `size` bytes of an object.
std::shared_ptr<RKMemoryRegion> region(RegionSizes sizes, uint64_t size = 4 * kPage, uint64_t objectId = 7) {
    auto made = std::make_shared<RKMemoryRegion>();
    made->object_id = objectId;
    made->size = size;
    made->share_mode = SM_SHARED;
    made->dirtySize = sizes.dirty;
    made->swappedSize = sizes.swapped;
    made->cleanNonSpecSize = sizes.clean;
    made->reclaimableSize = sizes.reclaimable;
    made->wired = sizes.wired;
    return made;
}

using Totals = std::array<uint64_t, 5>;  // dirty, swapped, clean, reclaimable, wired
Totals totalsOf(const RKMemoryObject& object) {
    return {object.totalDirtySize(), object.totalSwappedSize(), object.totalCleanSize(),
            object.totalReclaimableSize(), object.totalWiredSize()};
}

// The owned-memory breakdown setting, kept in a scripted platform for one scope.
struct ScopedBreakdown {
    explicit ScopedBreakdown(bool on) { RKAnalysisSettings::setBreakDownPhysMemspread(on); }
    ~ScopedBreakdown() { RKAnalysisSettings::resetCache(); }
    RKScopedPlatform scope{std::make_shared<RKScriptedPlatform>()};
};

using Mapping = std::pair<std::shared_ptr<RKProcess>, std::shared_ptr<RKMemoryRegion>>;

class RKMemoryObjectTest : public ::testing::Test {
protected:
    // Each process maps at an address of its own: mappings line up by object offset only.
    std::shared_ptr<RKMemoryObject> objectFrom(const std::vector<Mapping>& mappings, pid_t owner = -1) {
        auto object = std::make_shared<RKMemoryObject>();
        for (const auto& [process, mapping] : mappings) {
            mapping->start += 0x10000000ull * static_cast<uint64_t>(process->pid());
            object->addRegion(mapping, *process);
        }
        object->setOwnerPid(owner);
        object->finalize();
        return object;
    }

    ScopedBreakdown breakdown{false};
    std::shared_ptr<RKProcess> a = makeProcess(10), b = makeProcess(20), c = makeProcess(30);
};

}  // namespace

// Memory two processes reach through one object counts once; each keeps a view of its own only
// when some mapper does not see the whole object through a single region.
TEST_F(RKMemoryObjectTest, MappersShareTheObjectUnlessOneSeesLessThanTheWhole) {
    RegionSizes whole{.dirty = kPage, .wired = true};
    auto same = objectFrom({{a, region(whole, kPage)}, {b, region(whole, kPage)}});
    EXPECT_EQ(totalsOf(*same), (Totals{kPage, 0, 0, 0, kPage}));
    EXPECT_EQ(same->viewForProcess(*b), same);

    auto half = objectFrom({{a, region({.dirty = 2 * kPage, .clean = 2 * kPage})}, {b, region({.clean = 4 * kPage})}});
    EXPECT_EQ(totalsOf(*half), (Totals{2 * kPage, 0, 4 * kPage, 0, 0}));
    EXPECT_EQ(totalsOf(*half->viewForProcess(*a)), (Totals{2 * kPage, 0, 2 * kPage, 0, 0}));
    EXPECT_EQ(totalsOf(*half->viewForProcess(*b)), (Totals{0, 0, 4 * kPage, 0, 0}));
    EXPECT_EQ(half->viewForProcess(*c), half);  // not a mapper: the whole object
    // A copy shares the regions and the totals, never the views it was made from.
    auto copied = half->copy();
    ASSERT_EQ(copied->memoryRegions().size(), 2u);
    EXPECT_EQ(copied->memoryRegions()[1], half->memoryRegions()[1]);
    EXPECT_EQ(totalsOf(*copied), totalsOf(*half));
    EXPECT_EQ(copied->processMemoryRegions(), nullptr);
    EXPECT_EQ(copied->viewForProcess(*b), copied);

    // Kept for a mapper with two regions, or one that differs in wired bytes only; never for a
    // process alone, however it maps the object.
    EXPECT_TRUE(objectFrom({{a, region({})}, {a, region({})}, {b, region({})}})->processMemoryRegions());
    EXPECT_TRUE(objectFrom({{a, region({.wired = true})}, {b, region({})}})->processMemoryRegions());
    EXPECT_FALSE(objectFrom({{a, region({.dirty = kPage})}, {a, region({.clean = kPage})}})->processMemoryRegions());
}

// The view map starts with the first eligible (shared) region, then takes every region.
TEST_F(RKMemoryObjectTest, ViewsStartAtTheFirstSharedMapping) {
    auto first = region({.dirty = 4 * kPage}), last = region({.dirty = kPage});
    first->share_mode = last->share_mode = SM_PRIVATE;
    auto object = objectFrom({{a, first}, {b, region({.clean = kPage})}, {c, last}});
    EXPECT_EQ(object->viewForProcess(*a), object);
    EXPECT_EQ(object->viewForProcess(*c)->totalDirtySize(), kPage);
}

TEST_F(RKMemoryObjectTest, NonOwnersSeeOwnedDirtyAndSwappedAsClean) {
    RegionSizes owned{.dirty = 2 * kPage, .swapped = kPage, .clean = kPage, .reclaimable = kPage};
    auto object = objectFrom({{a, region(owned)}, {b, region(owned)}}, 10);
    EXPECT_EQ(object->viewForProcess(*a), object);
    EXPECT_EQ(totalsOf(*object->viewForProcess(*b)), (Totals{0, 0, 4 * kPage, 0, 0}));

    // B's own view has one clean page; the whole object's two dirty pages are added to it.
    auto kept = objectFrom({{a, region({.dirty = 2 * kPage})}, {b, region({.clean = kPage})}}, 10);
    EXPECT_EQ(totalsOf(*kept->viewForProcess(*b)), (Totals{0, 0, 3 * kPage, 0, 0}));
    EXPECT_EQ(kept->viewForProcess(*c), kept);  // outside a kept map: whole, although A owns it
}

TEST_F(RKMemoryObjectTest, SizesMergeBySubrangeAndNeverFromRegionsWithoutAnObject) {
    // A dirtied the first page and B the second: whole regions merged would count one of them.
    auto inA = region({.dirty = kPage}), inB = region({.dirty = kPage});
    inA->addSubrange(0, kPage, RKMemoryTotal{.dirty = kPage}, kPage);
    inB->addSubrange(kPage, kPage, RKMemoryTotal{.dirty = kPage}, kPage);
    EXPECT_EQ(objectFrom({{a, inA}, {b, inB}})->totalDirtySize(), 2 * kPage);

    auto noObject = objectFrom({{a, region({.dirty = kPage}, kPage, 0)}, {b, region({}, kPage, 0)}});
    EXPECT_EQ(totalsOf(*noObject), (Totals{0, 0, 0, 0, 0}));
    EXPECT_EQ(noObject->memoryRegions().size(), 2u);

    // One page mapped three times merges once, but with the breakdown on the object never shows
    // less than one process's own regions report; a process's view follows its mode.
    for (bool on : {false, true}) {
        ScopedBreakdown mode(on);
        RegionSizes page{.dirty = kPage, .swapped = kPage};
        auto object = objectFrom({{a, region(page, kPage)}, {a, region(page, kPage)}, {a, region(page, kPage)},
                                  {b, region({.clean = kPage}, kPage)}});
        uint64_t expected = on ? 3 * kPage : kPage;
        EXPECT_EQ(object->totalDirtySize(), expected) << on;
        EXPECT_EQ(object->totalSwappedSize(), expected) << on;
        EXPECT_EQ(object->viewForProcess(*a)->totalDirtySize(), expected) << on;
    }
}

// Which mappings may differ between processes (a view of their own) and which are worth
// splitting into subranges.
TEST(RKMemoryRegion, EligibilityForProcessViewsAndSubranges) {
    auto eligible = [](auto&& change) {
        auto made = region({.dirty = kPage, .clean = kPage});
        change(*made);
        return std::pair{made->eligibleForProcessView(), made->eligibleForSubrangesUsingPageSize(kPage)};
    };
    using Both = std::pair<bool, bool>;
    EXPECT_EQ(eligible([](auto&) {}), Both(true, true));
    EXPECT_EQ(eligible([](auto& r) { r.share_mode = SM_PRIVATE; }), Both(false, false));
    // Not worth splitting: wholly in one state, one page, owned.
    EXPECT_EQ(eligible([](auto& r) { r.reclaimableSize = r.size; }), Both(true, false));
    EXPECT_EQ(eligible([](auto& r) { r.size = kPage; }), Both(true, false));
    EXPECT_EQ(eligible([](auto& r) { r.ownedExclusivelyByParentProcess = true; }), Both(true, false));
}
