// Images of a live process: the fixture's own executable and libc are named by segment, their
// code clean and one object with the forked child's, their data dirty and the process's own.
#include <gtest/gtest.h>

#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKFixtureProcess.h"

namespace {

// The first region named `name` whose detail ends with `file`.
const RKMemoryRegion* segmentOf(const RKProcess& process, const std::string& name, const std::string& file) {
    for (const auto& region : *process.memoryRegions())
        if (region->name == name && region->detailedName.ends_with(file)) return region.get();
    return nullptr;
}

}  // namespace

TEST(RKImagesFixture, CodeIsCleanAndSharedDataDirtyAndPrivate) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    auto parent = RKProcess::processWithPid(fixture.pid()), child = RKProcess::processWithPid(fixture.childPid());
    ASSERT_TRUE(parent && child);
    parent->gatherData();
    child->gatherData();
    for (const std::string file : {"/memspread_fixture", "/libc.so.6"}) {
        SCOPED_TRACE(file);
        const RKMemoryRegion* text = segmentOf(*parent, ".text", file);
        const RKMemoryRegion* data = segmentOf(*parent, ".data", file);
        ASSERT_TRUE(text && data);
        EXPECT_EQ(text->segment, RKSegmentText);
        EXPECT_EQ(text->dirtySize, 0u);
        EXPECT_GT(text->cleanNonSpecSize, 0u);
        ASSERT_TRUE(segmentOf(*child, ".text", file));
        EXPECT_EQ(segmentOf(*child, ".text", file)->object_id, text->object_id) << "one object in both";
        EXPECT_EQ(data->segment, RKSegmentData);
        EXPECT_GT(data->dirtySize, 0u);
        ASSERT_TRUE(segmentOf(*child, ".data", file));
        EXPECT_NE(segmentOf(*child, ".data", file)->object_id, data->object_id) << "each process's own copy";
        EXPECT_TRUE(segmentOf(*parent, ".rodata", file)) << "read-only data of the image";
    }
}
