// The texts that describe memory held without a mapping: the SysV segment table (captured while
// the owned-memory fixture held a detached segment) and a dma-buf's fdinfo (in the kernel's
// format: the generic lines, then the buffer's). The SysV table is read once a gather.
#include <gtest/gtest.h>

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKOwnedObjectParsers.h"

namespace {

std::string testData(const char* name) {
    std::stringstream text;
    text << std::ifstream(std::string(MEMSPREAD_TEST_DATA "/") + name).rdbuf();
    return text.str();
}

}  // namespace

TEST(RKOwnedObjectParsersTest, SysVTableGivesEachSegmentsCreatorAttachCountAndPages) {
    std::vector<RKSysVSegment> segments = RKParseSysVShm(testData("sysvipc-shm.txt"));
    ASSERT_EQ(segments.size(), 1u);
    EXPECT_EQ(segments[0].shmid, 62);
    EXPECT_EQ(segments[0].size, 8388608u);
    EXPECT_EQ(segments[0].creator, 7938);
    EXPECT_EQ(segments[0].attached, 0u);
    EXPECT_EQ(segments[0].resident, 8388608u);
    EXPECT_EQ(segments[0].swapped, 0u);

    // Columns are found by name; a line that cannot be read is skipped.
    segments = RKParseSysVShm("shmid nattch cpid size swap rss\n7 2 100 4096 0 4096\nbroken line\n");
    ASSERT_EQ(segments.size(), 1u);
    EXPECT_EQ(segments[0].attached, 2u);
    EXPECT_EQ(segments[0].creator, 100);
    // A kernel that does not say how much is resident gives nothing rather than a guess.
    EXPECT_TRUE(RKParseSysVShm("key shmid perms size cpid lpid nattch\n0 7 600 4096 100 100 0\n").empty());
}

TEST(RKOwnedObjectParsersTest, DmaBufFdinfoGivesSizeInodeAndExporter) {
    auto info = RKParseDmaBufFdinfo(testData("fdinfo-dmabuf.txt"));
    ASSERT_TRUE(info);
    EXPECT_EQ(info->size, 8294400u);
    EXPECT_EQ(info->inode, 2051u);
    EXPECT_EQ(info->exporter, "system");
    // Not a dma-buf (an ordinary file's fdinfo), or no inode line: nothing.
    EXPECT_FALSE(RKParseDmaBufFdinfo("pos:\t0\nflags:\t0100002\nmnt_id:\t25\nino:\t12\n"));
    EXPECT_FALSE(RKParseDmaBufFdinfo("size:\t4096\nexp_name:\tsystem\n"));
}

// On a fake /proc whose table the test rewrites: one gather sees the table it read first, the
// next gather reads it again, and outside a gather every use reads it.
TEST(RKOwnedObjectParsersTest, SysVTableIsReadOnceAGather) {
    char pattern[] = "/tmp/memspread-proc-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    const std::filesystem::path root(pattern);
    std::filesystem::create_directory(root / "sysvipc");
    const std::string header = "shmid nattch cpid size swap rss\n";
    auto table = [&](const std::string& rows) { std::ofstream(root / "sysvipc" / "shm") << header << rows; };
    auto segmentCount = [](RKPlatform& platform) {
        std::vector<RKSysVSegment> segments;
        EXPECT_EQ(platform.sysVSegments(segments), 0);
        return segments.size();
    };
    RKLinuxPlatform platform(root.string());

    table("7 0 100 4096 0 4096\n");
    platform.beginGather();
    EXPECT_EQ(segmentCount(platform), 1u);
    table("7 0 100 4096 0 4096\n8 0 100 4096 0 4096\n");
    EXPECT_EQ(segmentCount(platform), 1u) << "read twice in one gather";
    platform.beginGather();  // an overlapping gather keeps the reading of the first
    platform.endGather();
    EXPECT_EQ(segmentCount(platform), 1u);
    platform.endGather();

    platform.beginGather();
    EXPECT_EQ(segmentCount(platform), 2u) << "a new gather reads the table anew";
    platform.endGather();
    table("");
    EXPECT_EQ(segmentCount(platform), 0u) << "outside a gather, every use reads it";
    std::filesystem::remove_all(root);
}
