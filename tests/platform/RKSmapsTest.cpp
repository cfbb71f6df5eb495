// From smaps text to region records: the parser, the mount table and the classifier, on captured
// files. The live fixture walk covers each kind this machine's kernel makes; these captures pin
// the kinds it cannot make (huge pages, devices, kernel objects) and what other kernels print.
#include <gtest/gtest.h>

#include "platform/RKLinuxTags.h"
#include "platform/RKLinuxVmaClassifier.h"
#include "support/RKRunCommand.h"

namespace {

// Both captures, parsed as one file, with the system they were taken on: the internal shmem
// mount was 0:1, the root file system 254:0 (fe:00 in smaps), /dev/shm the tmpfs 0:26 (00:1a)
// and /srv a btrfs 0:44 (00:2c).
class RKSmapsTest : public ::testing::Test {
protected:
    void SetUp() override {
        text_ = RKFileText(MEMSPREAD_TEST_DATA "/smaps-edge.txt") + RKFileText(MEMSPREAD_TEST_DATA "/smaps-fixture.txt");
        parsed_ = RKParseSmaps(text_, vmas_);
        mounts_ = RKParseMountInfo(
            "26 1 254:0 / / rw - ext4 /dev/vda rw\n"
            "29 24 0:26 / /dev/shm rw,relatime shared:5 master:1 - tmpfs tmpfs rw\n"
            "garbage line\n"
            "40 26 0:44 / /srv rw - btrfs /dev/vdb rw\n"
            "41 26 0:26 / /again rw - ext4 impossible rw");  // a device's first mount says its kind
        context_.shmemDevice = RKDeviceKey(0, 1);
        context_.mounts = &mounts_;
    }
    const RKSmapsVma& at(uint64_t start) {
        for (const auto& vma : vmas_)
            if (vma.start == start) return vma;
        ADD_FAILURE() << "no VMA at " << std::hex << start;
        static RKSmapsVma none;
        return none;
    }
    RKRegionSubmapInfo info(uint64_t start) { return RKRegionInfoForVma(at(start), kind(start), context_); }
    RKVmaKind kind(uint64_t start) { return RKClassifyVma(at(start), context_); }

    std::string text_;
    RKSmapsParseResult parsed_;
    std::vector<RKSmapsVma> vmas_;
    RKMountTable mounts_;
    RKVmaContext context_;
};

}  // namespace

TEST_F(RKSmapsTest, EachVmaBecomesTheRecordOfItsKind) {
    using K = RKVmaKind;
    struct Expected {
        uint64_t start;
        RKVmaKind kind;
        uint32_t tag;
        uint8_t shareMode;
        uint32_t dirtied;
        uint16_t wired;
        const char* detail;
    };
    const Expected table[] = {
        {0x7f0000000000, K::Hugetlb, RKTagHugetlb, SM_LARGE_PAGE, 512, 1, ""},  // in 4 KiB pages
        {0x7f0000600000, K::Hugetlb, RKTagHugetlb, SM_LARGE_PAGE, 1024, 1, "/SYSV00001234"},
        {0x7f0000200000, K::Anonymous, RKTagAnonymous, SM_PRIVATE, 4, 0, ""},  // locked on fault, partly there
        {0x7f0000210000, K::Anonymous, RKTagAnonymous, SM_PRIVATE, 4, 1, ""},  // locked on fault, all there
        {0x7f0000214000, K::Anonymous, RKTagAnonymous, SM_PRIVATE, 2, 0, "my buffer"},
        {0x7f0000221000, K::Anonymous, RKTagAnonymous, SM_COW, 16, 0, ""},  // pages inherited across fork
        // Read faults that got private pages rather than the zero page: only swap frees them.
        {0x7f8735c27000, K::Anonymous, RKTagAnonymous, SM_PRIVATE, 32, 0, ""},
        {0x7f0000218000, K::Shmem, RKTagSharedAnonymous, SM_SHARED, 4, 0, "ring"},
        // Privately mapped shmem: the object's pages are memory, never page cache.
        {0x7f0000241000, K::Shmem, RKTagPosixShm, SM_COW, 4, 0, "/dev/shm/shared file"},
        {0x7f000021d000, K::File, RKTagAnonymous, SM_COW, 0, 0, "/data/my file\\012name (deleted)"},  // 08:01
        {0x7f0000249000, K::File, RKTagAnonymous, SM_COW, 0, 0, "/srv/subvolume/lib.so"},  // major 0, mounted
        {0x7f0000231000, K::Device, RKTagDevice, SM_EMPTY, 0, 0, "/dev/dri/card0"},
        {0x7f8735ccc000, K::Device, RKTagVvar, SM_EMPTY, 0, 0, ""},  // a PFN map, still named
        {0x7f8735cd2000, K::Special, RKTagVdso, SM_EMPTY, 0, 0, ""},
        {0xffffffffff600000, K::Special, RKTagVsyscall, SM_EMPTY, 0, 0, ""},
        {0x7f000021c000, K::Special, RKTagKernelObject, SM_EMPTY, 0, 1, ""},  // secretmem
        {0x7f000024d000, K::Special, RKTagKernelObject, SM_EMPTY, 0, 0, "anon_inode:dmabuf"},  // 0:14, unmounted
    };
    for (const Expected& expected : table) {
        SCOPED_TRACE(testing::Message() << std::hex << expected.start);
        RKRegionSubmapInfo record = info(expected.start);
        EXPECT_EQ(kind(expected.start), expected.kind);
        EXPECT_EQ(record.user_tag, expected.tag);
        EXPECT_EQ(record.share_mode, expected.shareMode);
        EXPECT_EQ(record.pages_dirtied, expected.dirtied);
        EXPECT_EQ(record.user_wired_count, expected.wired);
        EXPECT_EQ(RKDetailForVma(at(expected.start), expected.kind), expected.detail);
        if (expected.kind == K::Device || expected.kind == K::Special) {
            EXPECT_EQ(record.object_id_full, 0u);
            EXPECT_EQ(record.pages_resident + record.pages_dirtied + record.pages_swapped_out, 0u);
        }
    }
    EXPECT_EQ(info(0x7f0000221000).pages_swapped_out, 2u);
}

TEST_F(RKSmapsTest, OneObjectHasOneIdWhateverMapsItAndNothingElseShares) {
    // A tmpfs file mapped shared and privately read-only: one object.
    EXPECT_EQ(info(0x7f0000241000).object_id_full, info(0x7f0000245000).object_id_full);

    // A SysV segment is its id in its IPC namespace: another namespace, another object.
    uint64_t sysv = info(0x7f0000600000).object_id_full;
    context_.ipcNamespace++;
    EXPECT_NE(info(0x7f0000600000).object_id_full, sysv);

    // The true identity of a mapped file replaces the maps line's.
    RKFileIdentity real{RKDeviceKey(0, 51), 1001};
    EXPECT_EQ(RKRegionInfoForVma(at(0x7f0000249000), RKVmaKind::File, context_, real).object_id_full,
              RKObjectIdForFile(RKObjectKindFile, real.device, real.inode));

    // Equal device and inode of different kinds never meet; private ids never meet object ids
    // and differ by process and by address, also above the exactly encoded addresses.
    EXPECT_NE(RKObjectIdForFile(RKObjectKindFile, 1, 24), RKObjectIdForFile(RKObjectKindShmem, 1, 24));
    const uint64_t high = 0xff7ffffffff000;
    EXPECT_EQ(RKPrivateObjectId(4194303, high, 4096) >> 62, 1u);
    EXPECT_NE(RKPrivateObjectId(1, high, 4096), RKPrivateObjectId(2, high, 4096));
    EXPECT_NE(RKPrivateObjectId(1, high, 4096), RKPrivateObjectId(1, high - 4096, 4096));
}

TEST_F(RKSmapsTest, ParsingSkipsWhatItCannotReadWithoutLosingItsNeighbours) {
    EXPECT_EQ(parsed_.malformedHeaders, 1u);

    // The fields after the unreadable header belong to no VMA: they must not leak into the one
    // before it (regression: a stray "VmFlags: lo" wired a SysV segment).
    EXPECT_FALSE(at(0x7f0000600000).vmFlags & RKVmLocked);

    // A file cut short in the middle of a VMA keeps what it has.
    const std::string text = text_.substr(0, text_.find("Rss:", text_.find("[anon:my buffer]")) + 10);
    std::vector<RKSmapsVma> cut;  // pointing into `text`
    RKParseSmaps(text, cut);
    ASSERT_FALSE(cut.empty());
    EXPECT_EQ(cut.back().path, "[anon:my buffer]");
    EXPECT_EQ(cut.back().vmFlags, 0u);
}

// Values that fill their 8 columns and values wider than them (a line longer than usual) read
// alike; a field that is not read, or a value that is not a number, changes nothing.
TEST(RKSmapsParser, ValuesOfEveryWidthReadAlike) {
    const std::string text =
        "7f0000000000-7f0000001000 rw-p 00000000 00:00 0 \n"
        "KernelPageSize: 12345678 kB\n"
        "Rss:            99999999 kB\n"
        "Shared_Dirty:   123456789 kB\n"
        "Private_Dirty:  123456789012 kB\n"
        "Swap:                  0 kB\n"
        "Shared_Clean:        4 2 kB\n"
        "LazyFree:                kB\n"
        "Anonymous:             7 kB\n"
        "VmFlags: rd wr mr mw me ac \n";
    std::vector<RKSmapsVma> vmas;
    RKParseSmaps(text, vmas);
    ASSERT_EQ(vmas.size(), 1u);
    EXPECT_EQ(vmas[0].rss, 99999999u);
    EXPECT_EQ(vmas[0].sharedDirty, 123456789u);
    EXPECT_EQ(vmas[0].privateDirty, 123456789012u);
    EXPECT_EQ(vmas[0].swap, 0u);
    EXPECT_EQ(vmas[0].sharedClean, 0u);
    EXPECT_EQ(vmas[0].lazyFree, 0u);
    EXPECT_EQ(vmas[0].anonymous, 7u);
    EXPECT_EQ(vmas[0].vmFlags, RKVmMayRead | RKVmMayWrite | RKVmMayExec);
}

// A memfd mapped privately and writable reaches the object's pages until written through; its
// copies then make it the process's own. (That its pages are memory, not clean page cache, the
// table above and RKOwnedMemoryFixture show.)
TEST_F(RKSmapsTest, PrivatelyMappedShmemReachesItsObjectUntilCopied) {
    RKSmapsVma vma = at(0x7f0000245000);
    vma.perms = RKSmapsRead | RKSmapsWrite;
    vma.rss = 32;
    EXPECT_EQ(RKRegionInfoForVma(vma, RKVmaKind::Shmem, context_).object_id_full, info(0x7f0000245000).object_id_full);
    vma.anonymous = 8;
    RKRegionSubmapInfo copied = RKRegionInfoForVma(vma, RKVmaKind::Shmem, context_);
    EXPECT_NE(copied.object_id_full, info(0x7f0000245000).object_id_full);
    EXPECT_EQ(std::pair(copied.pages_dirtied, copied.share_mode), std::pair(8u, uint8_t{SM_COW})) << "all 8 pages stay dirty";
}
