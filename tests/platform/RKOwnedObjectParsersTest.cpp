// The texts that describe memory held without a mapping: the SysV segment table (captured while
// the owned-memory fixture held a detached segment) and a dma-buf's fdinfo (in the kernel's
// format: the generic lines, then the buffer's).
#include <gtest/gtest.h>

#include <tuple>

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
