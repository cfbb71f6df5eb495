#include <gtest/gtest.h>

#include <unordered_set>

#include "RKModelTestSupport.h"
#include "model/RKMemoryCategory.h"
#include "model/RKProcessGroup.h"

namespace {

std::shared_ptr<RKMemoryObject> objectNamed(const std::string& detail, RegionSizes sizes, int regions = 1) {
    auto object = std::make_shared<RKMemoryObject>();
    for (int i = 0; i < regions; ++i) {
        auto region = makeRegion(5, 0, 4 * kPage, sizes, "mapped file");
        region->detailedName = detail;
        object->addRegion(region, kPage);
    }
    object->finalize();
    return object;
}

std::shared_ptr<RKProcessGroupMinimal> groupOf(std::initializer_list<pid_t> pids) {
    auto group = std::make_shared<RKProcessGroupMinimal>();
    for (pid_t pid : pids) group->addProcess(makeProcess(pid));
    return group;
}

}  // namespace

TEST(RKMemoryCategory, SumsObjectsAndViewsAndIsNamedByTheFirst) {
    RKMemoryCategory category, summary(true);
    category.addMemoryObject(objectNamed("/a", {.dirty = kPage, .clean = kPage}, 2));
    category.addMemoryObject(objectNamed("/b", {.swapped = kPage, .reclaimable = kPage}));
    EXPECT_EQ((std::array{category.totalDirtySize(), category.totalSwappedSize(), category.totalCleanSize(),
                          category.totalReclaimableSize()}),
              (std::array{kPage, kPage, kPage, kPage}));
    EXPECT_EQ(category.totalRegions(), 3);
    EXPECT_EQ(category.fullName(), "mapped file /a");
    summary.addMemoryObject(objectNamed("/a", {}));
    EXPECT_EQ(summary.fullName(), "mapped file");
    EXPECT_EQ(summary.detailedName(), "");

    // A non-owner's view of owned memory adds its dirty and swapped bytes as clean.
    ScopedBreakdown breakdown(false);
    auto owned = std::make_shared<RKMemoryObject>();
    owned->addRegion(makeRegion(5, 0, 4 * kPage, {.dirty = 2 * kPage, .swapped = kPage, .reclaimable = kPage}), kPage);
    owned->setOwnerPid(10);
    owned->finalize();
    RKMemoryCategory viewed;
    viewed.addMemoryObject(owned->viewForProcess(*makeProcess(20)));
    EXPECT_EQ((std::array{viewed.totalDirtySize(), viewed.totalSwappedSize(), viewed.totalCleanSize(),
                          viewed.totalReclaimableSize()}),
              (std::array<uint64_t, 4>{0, 0, 3 * kPage, 0}));
}

TEST(RKProcessGroup, HashFollowsPidsInOrderAndEqualityFollowsTheSet) {
    auto group = groupOf({1, 2});
    uint64_t hash = group->hash();
    group->addProcess(makeProcess(2));  // an equal process is already a member
    EXPECT_EQ(group->count(), 2u);
    EXPECT_EQ(group->hash(), hash);
    EXPECT_EQ(groupOf({1, 2})->hash(), hash);
    EXPECT_TRUE(groupOf({1, 2})->isEqual(*group));
    EXPECT_TRUE(groupOf({2, 1})->isEqual(*group));
    EXPECT_NE(groupOf({2, 1})->hash(), hash);
    EXPECT_FALSE(groupOf({1})->isEqual(*group));
}

TEST(RKProcessGroup, InterningFindsTwinsByContentAndKeepsInternedGroupsDistinct) {
    std::unordered_set<std::shared_ptr<RKProcessGroup>, RKProcessGroupHash, RKProcessGroupEqual> interned;
    auto minimal = groupOf({1, 2});
    auto group = minimal->immutableCopy();
    EXPECT_EQ(&group->processes(), &minimal->processes());  // the very same set
    EXPECT_EQ(group->hash(), minimal->hash());
    interned.insert(group);
    auto found = interned.find(*groupOf({1, 2}));
    ASSERT_NE(found, interned.end());
    EXPECT_EQ(*found, group);
    EXPECT_EQ(interned.find(*groupOf({1, 3})), interned.end());

    auto secondCopy = groupOf({1, 2})->immutableCopy();
    EXPECT_FALSE(secondCopy->isEqual(*group));
    EXPECT_TRUE(group->isEqual(*minimal));
    EXPECT_TRUE(interned.insert(secondCopy).second);
    EXPECT_DEATH(group->addProcess(makeProcess(3)), "Attempt to add process to immutable RKProcessGroup");
}

TEST(RKProcessGroup, CachedCategoriesAreHandedOutRefcountTimes) {
    auto group = groupOf({1, 2})->immutableCopy();
    EXPECT_EQ(group->consumeCachedCategories(), nullptr);
    auto categories = std::make_shared<RKCategoryMap>();
    group->attachCachedCategories(categories, 3);
    for (int i = 0; i < 3; ++i) EXPECT_EQ(group->consumeCachedCategories(), categories) << i;
    EXPECT_EQ(group->consumeCachedCategories(), nullptr);
    EXPECT_DEATH(group->attachCachedCategories(categories, 0), "refcount");
}
