// The text parsers of the Linux walk, on captured and constructed /proc files.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "platform/RKMountInfoParser.h"
#include "platform/RKProcStatusFigures.h"
#include "platform/RKSmapsParser.h"

namespace {

std::string readTestData(const std::string& name) {
    std::ifstream in(std::string(MEMSPREAD_TEST_DATA) + "/" + name);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

const RKSmapsVma* vmaAt(const std::vector<RKSmapsVma>& vmas, uint64_t start) {
    for (const auto& vma : vmas)
        if (vma.start == start) return &vma;
    return nullptr;
}

// Header lines counted independently of the parser: "hex-hex " at a line start.
size_t countHeaders(const std::string& text) {
    size_t count = 0;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        size_t dash = line.find('-');
        if (dash != std::string::npos && dash > 0 && line.find_first_not_of("0123456789abcdef") == dash) count++;
    }
    return count;
}

}  // namespace

TEST(RKSmapsParser, ReadsEveryVmaOfACapturedFileWithItsFields) {
    std::string text = readTestData("smaps-fixture.txt");
    ASSERT_FALSE(text.empty());
    std::vector<RKSmapsVma> vmas;
    RKSmapsParseResult result = RKParseSmaps(text, vmas);
    EXPECT_EQ(result.malformedHeaders, 0u);
    ASSERT_EQ(vmas.size(), countHeaders(text));
    for (size_t i = 1; i < vmas.size(); i++) EXPECT_LT(vmas[i - 1].start, vmas[i].start);

    // The executable's data segment: file offset and device in hex, inode in decimal.
    const RKSmapsVma* data = vmaAt(vmas, 0x5579ccef5000);
    ASSERT_NE(data, nullptr);
    EXPECT_EQ(data->end, 0x5579ccef6000u);
    EXPECT_EQ(data->offset, 0xf000u);
    EXPECT_EQ(data->devMajor, 0xfeu);
    EXPECT_EQ(data->devMinor, 0u);
    EXPECT_EQ(data->inode, 5310419u);
    EXPECT_EQ(data->perms, RKSmapsRead | RKSmapsWrite);
    EXPECT_EQ(data->path, "/home/user/build/tests/memspread_fixture");

    // The memory given back with MADV_FREE, and the mlocked memory.
    const RKSmapsVma* freed = vmaAt(vmas, 0x7f87356bb000);
    ASSERT_NE(freed, nullptr);
    EXPECT_EQ(freed->rss, 256u);
    EXPECT_EQ(freed->lazyFree, 128u);
    EXPECT_EQ(freed->anonymous, 256u);
    EXPECT_EQ(freed->privateDirty, 128u);
    EXPECT_TRUE(freed->path.empty());
    const RKSmapsVma* locked = vmaAt(vmas, 0x7f8735cc1000);
    ASSERT_NE(locked, nullptr);
    EXPECT_EQ(locked->vmFlags & (RKVmLocked | RKVmLockOnFault), RKVmLocked);
    EXPECT_TRUE(locked->vmFlags & RKVmMayWrite);

    const RKSmapsVma* memfd = vmaAt(vmas, 0x7f8735c7a000);
    ASSERT_NE(memfd, nullptr);
    EXPECT_EQ(memfd->perms, RKSmapsRead | RKSmapsWrite | RKSmapsShared);
    EXPECT_EQ(memfd->sharedDirty, 128u);
    EXPECT_EQ(memfd->path, "/memfd:memspread-fixture (deleted)");
    const RKSmapsVma* vvar = vmaAt(vmas, 0x7f8735ccc000);
    ASSERT_NE(vvar, nullptr);
    EXPECT_EQ(vvar->vmFlags & (RKVmIo | RKVmPfnMap), RKVmIo | RKVmPfnMap);
    const RKSmapsVma* vsyscall = vmaAt(vmas, 0xffffffffff600000);
    ASSERT_NE(vsyscall, nullptr);
    EXPECT_EQ(vsyscall->perms, RKSmapsExecute);
}

TEST(RKSmapsParser, SkipsWhatItCannotReadWithoutLosingItsNeighbours) {
    std::string text = readTestData("smaps-edge.txt");
    std::vector<RKSmapsVma> vmas;
    RKSmapsParseResult result = RKParseSmaps(text, vmas);
    EXPECT_EQ(result.malformedHeaders, 1u);
    ASSERT_EQ(vmas.size(), countHeaders(text) - 1);

    // The fields after the unreadable header belong to no VMA: they must not leak into the one
    // before it (regression: a stray "VmFlags: lo" would wire a hugetlb segment twice over).
    const RKSmapsVma* sysv = vmaAt(vmas, 0x7f0000600000);
    ASSERT_NE(sysv, nullptr);
    EXPECT_EQ(sysv->privateHugetlb, 4096u);
    EXPECT_EQ(sysv->rss, 0u);
    EXPECT_FALSE(sysv->vmFlags & RKVmLocked);
    EXPECT_TRUE(sysv->vmFlags & RKVmHugetlb);
    const RKSmapsVma* after = vmaAt(vmas, 0x7f0000800000);
    ASSERT_NE(after, nullptr);
    EXPECT_EQ(after->lazyFree, 8u);

    // Paths keep their spaces and the kernel's escape of a newline.
    const RKSmapsVma* odd = vmaAt(vmas, 0x7f000021d000);
    ASSERT_NE(odd, nullptr);
    EXPECT_EQ(odd->path, "/data/my file\\012name (deleted)");
    EXPECT_EQ(odd->devMajor, 8u);
    EXPECT_EQ(odd->devMinor, 1u);

    // A file cut short in the middle of a VMA keeps what it has.
    vmas.clear();
    std::string cut = text.substr(0, text.find("Rss:", text.find("[anon:my buffer]")) + 10);
    RKParseSmaps(cut, vmas);
    ASSERT_FALSE(vmas.empty());
    EXPECT_EQ(vmas.back().path, "[anon:my buffer]");
    EXPECT_EQ(vmas.back().vmFlags, 0u);
}

TEST(RKMountInfoParser, KeysDecimalDevicesToTheirFileSystemKind) {
    const char* text =
        "21 26 0:20 / /proc rw,relatime - proc proc rw\n"
        "24 23 0:22 / /dev/shm rw,relatime shared:5 master:1 - tmpfs tmpfs rw,size=24683620k\n"
        "26 1 254:0 / / rw,relatime - ext4 /dev/vda rw,discard\n"
        "31 26 0:45 / /mnt/huge rw,relatime - hugetlbfs hugetlbfs rw,pagesize=2M\n"
        "32 26 0:46 / /mnt/with\\040space rw - tmpfs none rw\n"
        "garbage line\n"
        "33 26 x:y / /bad rw - ext4 /dev/bad rw\n"
        "34 26 0:22 / /second/dev/shm rw - ext4 impossible rw";
    RKMountTable table = RKParseMountInfo(text);
    EXPECT_EQ(table.size(), 5u);
    EXPECT_EQ(table.at(RKDeviceKey(0, 22)), RKMountKind::Tmpfs);  // first mount of a device wins
    EXPECT_EQ(table.at(RKDeviceKey(254, 0)), RKMountKind::Other);
    EXPECT_EQ(table.at(RKDeviceKey(0, 45)), RKMountKind::Hugetlbfs);
    EXPECT_EQ(table.at(RKDeviceKey(0, 46)), RKMountKind::Tmpfs);
    EXPECT_EQ(table.count(RKDeviceKey(0xfe, 0)), 1u);
}

TEST(RKProcStatusFigures, ReadsTheMemoryLinesAndRefusesAStatusWithoutThem) {
    const char* live =
        "Name:\tmemspread_fixtu\nState:\tS (sleeping)\nVmPeak:\t    6016 kB\nVmHWM:\t    3072 kB\n"
        "VmRSS:\t    2900 kB\nRssAnon:\t    1020 kB\nRssFile:\t    1560 kB\nRssShmem:\t     320 kB\n"
        "VmPTE:\t      60 kB\nVmSwap:\t       8 kB\nHugetlbPages:\t    2048 kB\nThreads:\t1\n";
    auto figures = RKParseStatusFigures(live);
    ASSERT_TRUE(figures);
    EXPECT_EQ(figures->rssAnon, 1020u);
    EXPECT_EQ(figures->rssShmem, 320u);
    EXPECT_EQ(figures->vmSwap, 8u);
    EXPECT_EQ(figures->vmPTE, 60u);
    EXPECT_EQ(figures->hugetlbPages, 2048u);
    EXPECT_EQ(figures->vmHWM, 3072u);
    // A zombie's status stops before the memory lines.
    EXPECT_FALSE(RKParseStatusFigures("Name:\tdefunct\nState:\tZ (zombie)\nThreads:\t1\n"));
}
