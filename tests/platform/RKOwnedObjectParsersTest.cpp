// The texts that describe memory held without a mapping: the SysV segment table (captured while
// the owned-memory fixture held a detached segment) and a dma-buf's fdinfo (in the kernel's
// format: the generic lines, then the buffer's). The SysV table is read once a gather.
#include <gtest/gtest.h>

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <tuple>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKOwnedObjectParsers.h"
#include "support/RKRunCommand.h"

namespace {

// Every field of a segment, so that a mismatch prints them all.
auto fields(const RKSysVSegment& s) { return std::tuple(s.shmid, s.size, s.creator, s.attached, s.resident, s.swapped); }

}  // namespace

TEST(RKOwnedObjectParsersTest, SysVSegmentsAndDmaBufsAreReadFromTheKernelsTexts) {
    std::vector<RKSysVSegment> segments = RKParseSysVShm(RKFileText(MEMSPREAD_TEST_DATA "/sysvipc-shm.txt"));
    ASSERT_EQ(segments.size(), 1u);
    EXPECT_EQ(fields(segments[0]), fields({62, 8388608, 7938, 0, 8388608, 0}));

    // Columns are found by name; a line that cannot be read is skipped.
    segments = RKParseSysVShm("shmid nattch cpid size swap rss\n7 2 100 4096 0 4096\nbroken line\n");
    ASSERT_EQ(segments.size(), 1u);
    EXPECT_EQ(fields(segments[0]), fields({7, 4096, 100, 2, 4096, 0}));
    // A kernel that does not say how much is resident gives nothing rather than a guess.
    EXPECT_TRUE(RKParseSysVShm("key shmid perms size cpid lpid nattch\n0 7 600 4096 100 100 0\n").empty());

    // A dma-buf's fdinfo gives its size, inode and exporter.
    auto info = RKParseDmaBufFdinfo(RKFileText(MEMSPREAD_TEST_DATA "/fdinfo-dmabuf.txt"));
    ASSERT_TRUE(info);
    EXPECT_EQ(std::tie(info->size, info->inode, info->exporter), std::tuple(8294400u, 2051u, "system"));
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
