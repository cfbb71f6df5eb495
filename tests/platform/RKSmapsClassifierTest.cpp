// What each kind of Linux mapping becomes in the region walk, on captured and constructed smaps.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "platform/RKLinuxTags.h"
#include "platform/RKLinuxVmaClassifier.h"

namespace {

std::string readTestData(const std::string& name) {
    std::ifstream in(std::string(MEMSPREAD_TEST_DATA) + "/" + name);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

// A parsed capture together with the system it was captured on: the internal shmem mount was
// 0:1, the root file system 254:0 (0xfe:0x00 in smaps) and /dev/shm the tmpfs 0:26.
class RKSmapsClassifierTest : public ::testing::Test {
protected:
    void load(const std::string& file) {
        text_ = readTestData(file);
        RKParseSmaps(text_, vmas_);
        mounts_ = RKParseMountInfo(
            "26 1 254:0 / / rw - ext4 /dev/vda rw\n"
            "29 24 0:26 / /dev/shm rw - tmpfs tmpfs rw\n"
            "40 26 0:44 / /srv rw - btrfs /dev/vdb rw\n"
            "41 26 0:16 / /mnt/huge rw - hugetlbfs hugetlbfs rw\n");
        context_.pid = 4242;
        context_.pageSize = 4096;
        context_.shmemDevice = RKDeviceKey(0, 1);
        context_.mounts = &mounts_;
        context_.ipcNamespace = 4026531839;
    }
    const RKSmapsVma& at(uint64_t start) {
        for (const auto& vma : vmas_)
            if (vma.start == start) return vma;
        ADD_FAILURE() << "no VMA at " << std::hex << start;
        static RKSmapsVma none;
        return none;
    }
    RKRegionSubmapInfo info(uint64_t start) {
        const RKSmapsVma& vma = at(start);
        return RKRegionInfoForVma(vma, RKClassifyVma(vma, context_), context_);
    }
    RKVmaKind kind(uint64_t start) { return RKClassifyVma(at(start), context_); }
    std::string detail(uint64_t start) { return std::string(RKDetailForVma(at(start), kind(start))); }

    std::string text_;
    std::vector<RKSmapsVma> vmas_;
    RKMountTable mounts_;
    RKVmaContext context_;
};

bool isPrivateId(uint64_t id) { return (id >> 62) == 1; }

}  // namespace

// The live fixture test (RKLinuxWalkTest) covers each kind the fixture makes; this capture pins
// what depends on the kernel it was taken on.
TEST_F(RKSmapsClassifierTest, KernelMappingsAndReadFaultPagesOfTheCapture) {
    load("smaps-fixture.txt");
    for (uint64_t special : {0x7f8735ccc000ull, 0x7f8735cd0000ull, 0x7f8735cd2000ull, 0xffffffffff600000ull}) {
        RKRegionSubmapInfo record = info(special);
        EXPECT_EQ(record.object_id_full, 0u);
        EXPECT_EQ(record.pages_resident + record.pages_dirtied + record.pages_swapped_out, 0u);
    }
    EXPECT_EQ(kind(0x7f8735ccc000), RKVmaKind::Device);  // [vvar] is a PFN map, still named
    EXPECT_EQ(info(0x7f8735ccc000).user_tag, RKTagVvar);
    EXPECT_EQ(info(0x7f8735cd0000).user_tag, RKTagVvar);
    EXPECT_EQ(info(0x7f8735cd2000).user_tag, RKTagVdso);
    EXPECT_EQ(info(0xffffffffff600000).user_tag, RKTagVsyscall);
    EXPECT_EQ(info(0x7f87356ba000).share_mode, SM_EMPTY);  // a guard page: nothing there

    // The capture's kernel gives read faults a private page instead of the shared zero page
    // (Private_Clean, Anonymous): memory only swap could free, so it is dirty as RssAnon says.
    RKRegionSubmapInfo onlyRead = info(0x7f8735c27000);
    EXPECT_EQ(onlyRead.pages_resident, 32u);
    EXPECT_EQ(onlyRead.pages_dirtied, 32u);
    EXPECT_EQ(onlyRead.share_mode, SM_PRIVATE);
}

TEST_F(RKSmapsClassifierTest, HugePagesLocksDevicesAndKernelObjects) {
    load("smaps-edge.txt");
    RKRegionSubmapInfo huge = info(0x7f0000000000);
    EXPECT_EQ(kind(0x7f0000000000), RKVmaKind::Hugetlb);
    EXPECT_EQ(huge.user_tag, RKTagHugetlb);
    EXPECT_EQ(huge.share_mode, SM_LARGE_PAGE);
    EXPECT_EQ(huge.pages_resident, 512u);  // in the process's 4 KiB pages
    EXPECT_EQ(huge.pages_dirtied, 512u);
    EXPECT_EQ(huge.user_wired_count, 1);
    EXPECT_EQ(detail(0x7f0000000000), "");
    EXPECT_EQ(detail(0x7f0000400000), "huge");  // a hugetlb memfd keeps its name

    // Lock-on-fault wires a mapping only once every page is there.
    EXPECT_EQ(info(0x7f0000200000).user_wired_count, 0);
    EXPECT_EQ(info(0x7f0000210000).user_wired_count, 1);

    EXPECT_EQ(detail(0x7f0000214000), "my buffer");
    EXPECT_EQ(info(0x7f0000214000).user_tag, RKTagAnonymous);
    EXPECT_EQ(kind(0x7f0000218000), RKVmaKind::Shmem);
    EXPECT_EQ(info(0x7f0000218000).user_tag, RKTagSharedAnonymous);
    EXPECT_EQ(detail(0x7f0000218000), "ring");

    RKRegionSubmapInfo secret = info(0x7f000021c000);
    EXPECT_EQ(kind(0x7f000021c000), RKVmaKind::Special);
    EXPECT_EQ(secret.user_tag, RKTagKernelObject);
    EXPECT_EQ(secret.pages_dirtied, 0u);
    RKRegionSubmapInfo device = info(0x7f0000231000);
    EXPECT_EQ(device.user_tag, RKTagDevice);
    EXPECT_EQ(device.object_id_full, 0u);
    EXPECT_EQ(detail(0x7f0000231000), "/dev/dri/card0");
    EXPECT_EQ(kind(0x7f000024d000), RKVmaKind::Special);  // major 0, mounted nowhere
    EXPECT_EQ(kind(0x7f0000249000), RKVmaKind::File);     // major 0, but a mounted file system
    EXPECT_EQ(kind(0x7f000021d000), RKVmaKind::File);     // a block device nobody shows us

    // Pages inherited across fork make private anonymous memory copy-on-write; swap counts.
    RKRegionSubmapInfo inherited = info(0x7f0000221000);
    EXPECT_EQ(inherited.share_mode, SM_COW);
    EXPECT_EQ(inherited.pages_dirtied, 16u);
    EXPECT_EQ(inherited.pages_swapped_out, 2u);
}

TEST_F(RKSmapsClassifierTest, OneObjectHasOneIdWhateverMapsItAndNothingElseShares) {
    load("smaps-edge.txt");
    // A tmpfs file mapped shared and privately read-only: one object.
    RKRegionSubmapInfo privateView = info(0x7f0000241000);
    RKRegionSubmapInfo sharedView = info(0x7f0000245000);
    EXPECT_EQ(privateView.object_id_full, sharedView.object_id_full);
    EXPECT_EQ(privateView.user_tag, RKTagPosixShm);
    EXPECT_EQ(sharedView.pages_swapped_out, 1u);

    // A SysV segment is its id in its IPC namespace: another namespace, another object.
    RKRegionSubmapInfo sysv = info(0x7f0000600000);
    EXPECT_EQ(sysv.object_id_full, RKObjectIdForFile(RKObjectKindSysV, context_.ipcNamespace, 7));
    context_.ipcNamespace++;
    EXPECT_NE(info(0x7f0000600000).object_id_full, sysv.object_id_full);

    // The true identity of a mapped file replaces the maps line's.
    const RKSmapsVma& lib = at(0x7f0000249000);
    RKFileIdentity real{RKDeviceKey(0, 51), 1001};
    EXPECT_EQ(RKRegionInfoForVma(lib, RKVmaKind::File, context_, real).object_id_full,
              RKObjectIdForFile(RKObjectKindFile, real.device, real.inode));

    // Equal device and inode of different kinds never meet; private ids never meet object
    // ids, 0 or all ones, and differ by process and by address.
    EXPECT_NE(RKObjectIdForFile(RKObjectKindFile, 1, 24), RKObjectIdForFile(RKObjectKindShmem, 1, 24));
    EXPECT_NE(RKObjectIdForFile(RKObjectKindShmem, 1, 24), RKObjectIdForFile(RKObjectKindShmem, 1, 25));
    std::vector<uint64_t> ids;
    for (pid_t pid : {1, 2, 4194303})
        for (uint64_t start : {0x1000ull, 0x2000ull, 0x7ffffffff000ull, 0xff7ffffffff000ull, 0xff7fffffffe000ull}) {
            uint64_t id = RKPrivateObjectId(pid, start, 4096);
            EXPECT_TRUE(isPrivateId(id));
            for (uint64_t other : ids) EXPECT_NE(id, other);
            ids.push_back(id);
        }
}
