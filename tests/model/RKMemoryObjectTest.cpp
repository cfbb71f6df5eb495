#include "model/RKMemoryObject.h"

#include <gtest/gtest.h>

#include "RKModelTestSupport.h"

namespace {

using Totals = std::array<uint64_t, 5>;  // dirty, swapped, clean, reclaimable, wired

class RKMemoryObjectTest : public ::testing::Test {
protected:
    std::shared_ptr<RKMemoryObject> objectOf(std::initializer_list<std::pair<RKProcess*, RegionSizes>> mappings,
                                             pid_t owner = -1, uint64_t size = 4 * kPage) {
        auto object = std::make_shared<RKMemoryObject>();
        for (const auto& [process, sizes] : mappings) object->addRegion(makeRegion(7, 0, size, sizes), *process);
        object->setOwnerPid(owner);
        object->finalize();
        return object;
    }

    ScopedBreakdown breakdown{false};
    std::shared_ptr<RKProcess> a = makeProcess(10), b = makeProcess(20), c = makeProcess(30);
};

}  // namespace

TEST_F(RKMemoryObjectTest, MappingsThatSeeItWholeShareTheObjectAsTheirView) {
    auto inA = makeRegion(7, 0, 2 * kPage, {.dirty = 2 * kPage}), inB = makeRegion(7, 0, 2 * kPage, {.dirty = 2 * kPage});
    inA->wired = inB->wired = true;
    inB->start = 0x7f0000000000;  // another address, the same object offsets
    auto object = std::make_shared<RKMemoryObject>();
    object->addRegion(inA, *a);
    object->addRegion(inB, *b);
    object->finalize();
    EXPECT_EQ(totalsOf(*object), (Totals{2 * kPage, 0, 0, 0, 2 * kPage}));  // counted once
    EXPECT_EQ(object->memoryRegions().size(), 2u);
    EXPECT_FALSE(object->processMemoryRegions());
    EXPECT_FALSE(object->couldHaveProcessView());
    EXPECT_EQ(object->viewForProcess(*b), object);

    auto alone = objectOf({{a.get(), {.dirty = kPage}}, {a.get(), {.clean = kPage}}});
    EXPECT_FALSE(alone->processMemoryRegions());  // one process never keeps views
    EXPECT_FALSE(alone->couldHaveProcessView());
    EXPECT_TRUE(objectOf({{a.get(), {}}}, 10)->couldHaveProcessView());
}

TEST_F(RKMemoryObjectTest, DifferingMappingsKeepPerProcessViews) {
    auto object = objectOf({{a.get(), {.dirty = 2 * kPage, .clean = 2 * kPage}}, {b.get(), {.clean = 4 * kPage}}});
    EXPECT_EQ(totalsOf(*object), (Totals{2 * kPage, 0, 4 * kPage, 0, 0}));
    ASSERT_TRUE(object->processMemoryRegions());
    EXPECT_TRUE(object->couldHaveProcessView());
    EXPECT_EQ(totalsOf(*object->viewForProcess(*a)), (Totals{2 * kPage, 0, 2 * kPage, 0, 0}));
    EXPECT_EQ(totalsOf(*object->viewForProcess(*b)), (Totals{0, 0, 4 * kPage, 0, 0}));
    EXPECT_EQ(object->viewForProcess(*a)->memoryRegions().size(), 1u);
    EXPECT_EQ(object->viewForProcess(*c), object);  // not a mapper: the whole object

    // Each mapper's first region matches the totals, but A maps the object twice.
    EXPECT_TRUE(objectOf({{a.get(), {.dirty = kPage}}, {a.get(), {.dirty = kPage}}, {b.get(), {.dirty = kPage}}},
                         -1, kPage)->processMemoryRegions());
    // B's single region lacks one of the five sizes that A's region and the object have.
    for (int lacking = 0; lacking < 5; ++lacking) {
        auto inA = makeRegion(7, 0, 2 * kPage, {kPage, kPage, kPage, kPage}), inB = makeRegion(7, 0, 2 * kPage);
        inA->wired = true;
        inB->wired = lacking != 4;
        uint64_t* sizes[] = {&inB->dirtySize, &inB->swappedSize, &inB->cleanNonSpecSize, &inB->reclaimableSize};
        for (int i = 0; i < 4; ++i) *sizes[i] = i == lacking ? 0 : kPage;
        auto object2 = std::make_shared<RKMemoryObject>();
        object2->addRegion(inA, *a);
        object2->addRegion(inB, *b);
        object2->finalize();
        EXPECT_TRUE(object2->processMemoryRegions()) << lacking;
    }
}

TEST_F(RKMemoryObjectTest, TheViewMapStartsAtTheFirstEligibleRegionAndThenTakesAll) {
    auto object = std::make_shared<RKMemoryObject>();
    auto first = makeRegion(7, 0, 4 * kPage, {.dirty = 4 * kPage}), last = makeRegion(7, 0, 4 * kPage, {.dirty = kPage});
    first->share_mode = last->share_mode = SM_PRIVATE;
    object->addRegion(first, *a);
    object->addRegion(makeRegion(7, 0, 4 * kPage, {.clean = kPage}), *b);
    object->addRegion(last, *c);
    object->finalize();
    ASSERT_TRUE(object->processMemoryRegions());
    EXPECT_EQ(object->processMemoryRegions()->count(10), 0u);
    EXPECT_EQ(object->viewForProcess(*a), object);
    EXPECT_EQ(object->viewForProcess(*c)->totalDirtySize(), kPage);
}

TEST_F(RKMemoryObjectTest, NonOwnersSeeOwnedDirtyAndSwappedAsClean) {
    RegionSizes owned{.dirty = 2 * kPage, .swapped = kPage, .clean = kPage, .reclaimable = kPage};
    auto object = objectOf({{a.get(), owned}, {b.get(), owned}}, 10);
    EXPECT_EQ(object->viewForProcess(*a), object);
    auto seenByB = object->viewForProcess(*b);
    EXPECT_EQ(totalsOf(*seenByB), (Totals{0, 0, 4 * kPage, 0, 0}));
    EXPECT_EQ(&seenByB->memoryRegions(), &object->memoryRegions());  // shared, not duplicated

    // B's own view has one clean page; the whole object's two dirty pages are added to it.
    auto kept = objectOf({{a.get(), {.dirty = 2 * kPage}}, {b.get(), {.clean = kPage}}}, 10, 2 * kPage);
    ASSERT_TRUE(kept->processMemoryRegions());
    EXPECT_EQ(totalsOf(*kept->viewForProcess(*b)), (Totals{0, 0, 3 * kPage, 0, 0}));
    EXPECT_EQ(kept->viewForProcess(*c), kept);  // outside a kept map: whole, although A owns it
}

TEST_F(RKMemoryObjectTest, AccountingModes) {
    // Regions without a VM object are listed but add nothing to the merged ranges.
    auto noObject = std::make_shared<RKMemoryObject>(), bySums = std::make_shared<RKMemoryObject>();
    for (auto& object : {noObject, bySums}) {
        object->addRegion(makeRegion(0, 0, 2 * kPage, {.dirty = 2 * kPage}), *a);
        object->addRegion(makeRegion(0, 0, kPage, {.swapped = kPage}), *b);
    }
    noObject->finalize();
    bySums->finalizeUsingRegionDirtySize(true);
    EXPECT_EQ(totalsOf(*noObject), (Totals{0, 0, 0, 0, 0}));
    EXPECT_EQ(noObject->memoryRegions().size(), 2u);
    EXPECT_EQ(totalsOf(*bySums), (Totals{2 * kPage, kPage, 0, 0, 0}));

    // One page mapped three times: merged once, but with the breakdown on never below what
    // one process's regions report; a process's view follows its own mode.
    for (bool on : {false, true}) {
        ScopedBreakdown mode(on);
        RegionSizes page{.dirty = kPage, .swapped = kPage};
        auto object = objectOf({{a.get(), page}, {a.get(), page}, {a.get(), page}, {b.get(), {.clean = kPage}}}, -1, kPage);
        uint64_t expected = on ? 3 * kPage : kPage;
        EXPECT_EQ(object->totalDirtySize(), expected) << on;
        EXPECT_EQ(object->totalSwappedSize(), expected) << on;
        EXPECT_EQ(object->viewForProcess(*a)->totalDirtySize(), expected) << on;
    }
}

TEST_F(RKMemoryObjectTest, SubrangesMergeByObjectOffsetAndAreDropped) {
    auto inA = makeRegion(7, 0, 4 * kPage, {.dirty = kPage, .clean = kPage});
    inA->addSubrange(0, kPage, RKMemoryTotal{.dirty = kPage}, kPage);
    inA->addSubrange(2 * kPage, kPage, RKMemoryTotal{.clean = kPage, .regions = 5}, kPage);
    auto inB = makeRegion(7, 0, 4 * kPage, {.dirty = kPage, .clean = 3 * kPage});
    inB->start = 0x5000000;
    inB->addSubrange(0, kPage, RKMemoryTotal{.dirty = kPage}, kPage);
    inB->addSubrange(kPage, 3 * kPage, RKMemoryTotal{.clean = 3 * kPage}, kPage);
    auto object = std::make_shared<RKMemoryObject>();
    object->addRegion(inA, *a);
    object->addRegion(inB, *b);
    EXPECT_EQ(inA->subrangeList(), nullptr);
    object->finalize();
    EXPECT_EQ(totalsOf(*object), (Totals{kPage, 0, 3 * kPage, 0, 0}));  // the dirty page once
}

TEST_F(RKMemoryObjectTest, NamesComeFromTheCanonicalRegion) {
    auto unused = makeRegion(7, 0, kPage, {}, "unused shared lib"), image = makeRegion(7, kPage, kPage, {}, "libfoo.so");
    unused->inSharedCache = unused->unusedSharedCacheRegion = image->inSharedCache = true;
    image->detailedName = "/usr/lib/libfoo.so";
    auto cache = std::make_shared<RKMemoryObject>();
    cache->addRegion(unused, *a);
    cache->addRegion(image, *a);
    EXPECT_EQ(cache->fullName(), "libfoo.so /usr/lib/libfoo.so");

    // Owned but unmapped memory first: with an owner, the mapping names the object and the
    // fake region; without one, the first region names it.
    for (pid_t owner : {10, -1}) {
        auto fake = makeRegion(9, 0, kPage, {}, RKMemoryRegion::categoryNameForTag(RKFakeRegionTag));
        fake->user_tag = RKFakeRegionTag;
        auto mapping = makeRegion(9, 0, kPage, {}, "memfd");
        mapping->detailedName = "buffer";
        auto object = std::make_shared<RKMemoryObject>();
        object->addRegion(fake, *a);
        object->addRegion(mapping, *b);
        object->setOwnerPid(owner);
        EXPECT_TRUE(object->containsFakeRegion());
        object->finalize();
        std::string expected = owner == -1 ? "Owned physical memspread (unmapped)" : "memfd buffer";
        EXPECT_EQ(object->fullName(), expected);
        EXPECT_EQ(fake->fullName(), expected);
    }
}

TEST_F(RKMemoryObjectTest, ProgrammingErrorsStop) {
    auto object = std::make_shared<RKMemoryObject>();
    object->addRegion(makeRegion(7, 0, kPage), *a);
    EXPECT_DEATH(object->copy(), "not finalized");
    object->finalize();
    EXPECT_DEATH(object->finalize(), "finalized twice");
    EXPECT_DEATH(object->addRegion(makeRegion(7, 0, kPage), *a), "finalized");
}
