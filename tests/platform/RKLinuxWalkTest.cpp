// The Linux region walk on real processes: the fixture program maps one area of each kind in
// a known way, and the walk must report each as what it is, sized as the fixture touched it.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <charconv>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxTags.h"
#include "platform/RKLinuxVmaClassifier.h"
#include "support/RKFixtureProcess.h"

namespace {

struct WalkedRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    RKRegionSubmapInfo info;
    std::optional<std::string> name;
};

struct Walk {
    kern_return_t taskResult = KERN_FAILURE;
    std::vector<WalkedRegion> regions;
    kern_return_t end = KERN_SUCCESS;

    const WalkedRegion* at(uint64_t address) const {
        for (const auto& region : regions)
            if (region.start <= address && address < region.start + region.size) return &region;
        return nullptr;
    }
};

// Walks like the process layer does: from address 0, each call at the end of the last region.
Walk walk(RKPlatform& platform, RKTask& task) {
    Walk result;
    result.taskResult = KERN_SUCCESS;
    uint64_t address = 0;
    for (;;) {
        uint64_t size = 0;
        WalkedRegion region;
        uint32_t count = 0;
        result.end = platform.regionRecurse(task, address, size, region.info, count);
        if (result.end != KERN_SUCCESS) break;
        region.start = address;
        region.size = size;
        region.name = platform.regionFileName(task, address);
        result.regions.push_back(region);
        if (address + size <= address) break;
        address += size;
    }
    return result;
}

Walk walk(RKPlatform& platform, pid_t pid) {
    std::unique_ptr<RKTask> task;
    kern_return_t result = platform.taskForPid(pid, task);
    if (result != KERN_SUCCESS) {
        Walk failed;
        failed.taskResult = result;
        return failed;
    }
    return walk(platform, *task);
}

uint64_t pageSize() { return static_cast<uint64_t>(sysconf(_SC_PAGESIZE)); }

// A "Name:  N kB" line of a /proc file, in kB.
uint64_t procField(const std::string& path, const std::string& name) {
    std::ifstream in(path);
    for (std::string line; std::getline(in, line);) {
        if (line.rfind(name + ":", 0) != 0) continue;
        size_t digit = line.find_first_of("0123456789");
        uint64_t value = 0;
        if (digit != std::string::npos) std::from_chars(line.data() + digit, line.data() + line.size(), value);
        return value;
    }
    return 0;
}

bool isObjectId(uint64_t id) { return (id >> 63) == 1; }
bool isPrivateId(uint64_t id) { return (id >> 62) == 1; }

class RKLinuxWalkTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        fixture_ = new RKFixtureProcess;
        ASSERT_TRUE(fixture_->start(MEMSPREAD_FIXTURE)) << fixture_->error();
        RKLinuxPlatform platform;
        parent_ = new Walk(walk(platform, fixture_->pid()));
        child_ = new Walk(walk(platform, fixture_->childPid()));
    }
    static void TearDownTestSuite() {
        delete fixture_;  // stops and reaps it
        delete parent_;
        delete child_;
        fixture_ = nullptr;
        parent_ = child_ = nullptr;
    }
    void SetUp() override {
        ASSERT_TRUE(parent_ && child_) << "the fixture did not start";
        ASSERT_EQ(parent_->taskResult, KERN_SUCCESS);
        ASSERT_EQ(parent_->end, KERN_INVALID_ADDRESS);
        ASSERT_EQ(child_->end, KERN_INVALID_ADDRESS);
    }

    // The parent's (or child's) region of the fixture's area `name`; it must span the area.
    static const WalkedRegion& region(const std::string& name, const Walk* of = nullptr) {
        static WalkedRegion none;
        auto area = fixture_->area(name);
        if (!area) {
            ADD_FAILURE() << "the fixture made no " << name;
            return none;
        }
        const WalkedRegion* found = (of ? of : parent_)->at(area->address);
        if (!found) {
            ADD_FAILURE() << "no region at " << name;
            return none;
        }
        EXPECT_LE(found->start + found->size, area->address + area->size + (name == "heap" ? found->size : 0))
            << name << " merged with a neighbour";
        return *found;
    }
    static uint32_t pages(const std::string& name) {
        auto area = fixture_->area(name);
        return area ? static_cast<uint32_t>(area->size / pageSize()) : 0;
    }

    static RKFixtureProcess* fixture_;
    static Walk* parent_;
    static Walk* child_;
};

RKFixtureProcess* RKLinuxWalkTest::fixture_ = nullptr;
Walk* RKLinuxWalkTest::parent_ = nullptr;
Walk* RKLinuxWalkTest::child_ = nullptr;

}  // namespace

TEST_F(RKLinuxWalkTest, AnonymousMemoryIsSizedByWhatTheFixtureDidToIt) {
    const WalkedRegion& written = region("anon_written");
    EXPECT_EQ(written.size, pages("anon_written") * pageSize());
    EXPECT_EQ(written.info.pages_resident, pages("anon_written"));
    EXPECT_EQ(written.info.pages_dirtied, pages("anon_written"));
    EXPECT_EQ(written.info.share_mode, SM_PRIVATE);
    EXPECT_EQ(written.info.user_tag, RKTagAnonymous);
    EXPECT_EQ(written.info.external_pager, 0);
    EXPECT_FALSE(written.name);

    // Reads of untouched memory map the shared zero page on most kernels (nothing resident);
    // some kernels give each read fault a page of its own, which is then the process's cost.
    const WalkedRegion& read = region("anon_read");
    EXPECT_EQ(read.info.pages_dirtied, read.info.pages_resident);
    if (read.info.pages_resident == 0) {
        EXPECT_EQ(read.info.share_mode, SM_EMPTY);
    } else {
        EXPECT_EQ(read.info.pages_resident, pages("anon_read"));
    }

    // MADV_FREE skips a page that someone else holds locked or isolated at that moment, so a
    // page or two of the freed half may stay dirty; none may be lost or counted twice.
    const WalkedRegion& freed = region("madv_free");
    EXPECT_LE(freed.info.pages_reusable, pages("madv_free") / 2);
    EXPECT_GE(freed.info.pages_reusable, pages("madv_free") / 2 - 4);
    EXPECT_EQ(freed.info.pages_dirtied + freed.info.pages_reusable, pages("madv_free"));

    const WalkedRegion& locked = region("mlocked");
    EXPECT_EQ(locked.info.user_wired_count, 1);
    EXPECT_EQ(locked.info.pages_dirtied, pages("mlocked"));
    EXPECT_EQ(written.info.user_wired_count, 0);

    const WalkedRegion& heap = region("heap");
    EXPECT_EQ(heap.info.user_tag, RKTagHeap);
    EXPECT_GE(heap.info.pages_dirtied, pages("heap"));

    // Written before the fork, the pages are mapped by both processes until one writes.
    EXPECT_EQ(region("anon_inherited").info.share_mode, SM_COW);
    EXPECT_EQ(region("anon_inherited", child_).info.share_mode, SM_COW);
}

TEST_F(RKLinuxWalkTest, SharedMemoryIsOneObjectInParentAndChildPrivateMemoryNever) {
    struct Expected {
        const char* area;
        uint32_t tag;
    };
    for (Expected expected : {Expected{"memfd", RKTagMemfd}, Expected{"shared_anon", RKTagSharedAnonymous},
                              Expected{"sysv", RKTagSysVShm}}) {
        SCOPED_TRACE(expected.area);
        const WalkedRegion& mine = region(expected.area);
        const WalkedRegion& childs = region(expected.area, child_);
        EXPECT_TRUE(isObjectId(mine.info.object_id_full));
        EXPECT_EQ(mine.info.object_id_full, childs.info.object_id_full);
        EXPECT_EQ(mine.info.user_tag, expected.tag);
        EXPECT_EQ(childs.info.user_tag, expected.tag);
        EXPECT_EQ(mine.info.share_mode, SM_SHARED);
        EXPECT_EQ(mine.info.external_pager, 0);  // memory the processes cost, not page cache
        EXPECT_EQ(mine.info.pages_dirtied, pages(expected.area));
        EXPECT_EQ(childs.info.pages_resident, pages(expected.area));  // the child read it all
    }
    EXPECT_NE(region("memfd").info.object_id_full, region("shared_anon").info.object_id_full);
    EXPECT_EQ(region("memfd").name, "memspread-fixture");
    EXPECT_EQ(region("sysv").name.value_or("").rfind("/SYSV", 0), 0u);

    const WalkedRegion& mine = region("anon_inherited");
    const WalkedRegion& childs = region("anon_inherited", child_);
    EXPECT_TRUE(isPrivateId(mine.info.object_id_full));
    EXPECT_TRUE(isPrivateId(childs.info.object_id_full));
    EXPECT_NE(mine.info.object_id_full, childs.info.object_id_full);
}

TEST_F(RKLinuxWalkTest, FilesArePageCacheWithTheFilesIdentityPosixShmIsMemory) {
    const WalkedRegion& readOnly = region("file_private");
    ASSERT_TRUE(readOnly.name);
    struct stat st {};
    ASSERT_EQ(::stat(readOnly.name->c_str(), &st), 0) << *readOnly.name;
    EXPECT_EQ(readOnly.info.object_id_full,
              RKObjectIdForFile(RKObjectKindFile, RKDeviceKey(major(st.st_dev), minor(st.st_dev)), st.st_ino));
    EXPECT_EQ(readOnly.info.external_pager, 1);
    EXPECT_EQ(readOnly.info.pages_resident, pages("file_private"));
    EXPECT_EQ(readOnly.info.pages_dirtied, 0u);
    EXPECT_EQ(readOnly.info.share_mode, SM_COW);

    const WalkedRegion& cow = region("file_cow");
    EXPECT_EQ(cow.info.pages_dirtied, 4u);
    EXPECT_TRUE(isPrivateId(cow.info.object_id_full));
    EXPECT_EQ(cow.info.external_pager, 1);

    const WalkedRegion& shared = region("file_shared");
    EXPECT_EQ(shared.info.share_mode, SM_SHARED);
    EXPECT_EQ(shared.info.pages_resident, pages("file_shared") / 2);
    EXPECT_EQ(shared.info.pages_dirtied, pages("file_shared") / 2);  // until the flusher writes them
    EXPECT_TRUE(isObjectId(shared.info.object_id_full));

    if (!fixture_->area("dev_shm")) GTEST_SKIP() << "no /dev/shm on this system";
    const WalkedRegion& posix = region("dev_shm");
    EXPECT_EQ(posix.info.user_tag, RKTagPosixShm);
    EXPECT_EQ(posix.info.external_pager, 0);
    EXPECT_EQ(posix.info.pages_dirtied, pages("dev_shm"));
    EXPECT_EQ(posix.name, "/dev/shm/memspread-fixture-" + std::to_string(fixture_->pid()));
}

TEST_F(RKLinuxWalkTest, TheKernelsOwnMappingsAreListedAndCostNothing) {
    bool sawVdso = false;
    for (const auto& walked : parent_->regions) {
        uint32_t tag = walked.info.user_tag;
        if (tag < RKTagVdso || tag > RKTagKernelObject) continue;
        sawVdso |= tag == RKTagVdso;
        EXPECT_EQ(walked.info.object_id_full, 0u);
        EXPECT_EQ(walked.info.pages_resident + walked.info.pages_dirtied + walked.info.pages_swapped_out, 0u);
    }
    EXPECT_TRUE(sawVdso);
    // Regions come in ascending order without overlap, and the walk ends normally.
    for (size_t i = 1; i < parent_->regions.size(); i++)
        EXPECT_GE(parent_->regions[i].start, parent_->regions[i - 1].start + parent_->regions[i - 1].size);
}

// Dirty + swapped pages are what the kernel counts as the process's anonymous, shmem and swap
// pages, less its lazily freed ones. Two kinds of page differ by design: dirty pages of shared
// file mappings (page cache to the kernel, counted here because writeback must clean them)
// and swapped shmem (in smaps, not in VmSwap); with no swap the second is 0.
TEST_F(RKLinuxWalkTest, DirtyAndSwappedPagesAgreeWithTheKernelsOwnFigure) {
    for (pid_t pid : {fixture_->pid(), fixture_->childPid()}) {
        SCOPED_TRACE(pid);
        const Walk* walked = pid == fixture_->pid() ? parent_ : child_;
        uint64_t ours = 0, sharedFileDirty = 0;
        for (const auto& region : walked->regions) {
            ours += region.info.pages_dirtied + region.info.pages_swapped_out;
            if (region.info.external_pager && region.info.share_mode == SM_SHARED)
                sharedFileDirty += region.info.pages_dirtied;
        }
        std::string proc = "/proc/" + std::to_string(pid);
        uint64_t kernelKB = procField(proc + "/status", "RssAnon") + procField(proc + "/status", "RssShmem") +
                            procField(proc + "/status", "VmSwap") - procField(proc + "/smaps_rollup", "LazyFree");
        int64_t kernel = static_cast<int64_t>(kernelKB * 1024 / pageSize());
        int64_t difference = static_cast<int64_t>(ours - sharedFileDirty) - kernel;
        EXPECT_LE(std::abs(difference), 4) << "ours " << ours << " kernel " << kernel;
        if (pid == fixture_->pid()) {
            EXPECT_LE(sharedFileDirty, pages("file_shared"));
        }
    }
}

TEST_F(RKLinuxWalkTest, PerProcessFiguresComeFromTheProcessStatus) {
    RKLinuxPlatform platform;
    std::unique_ptr<RKTask> task;
    ASSERT_EQ(platform.taskForPid(fixture_->pid(), task), KERN_SUCCESS);
    RKRusageInfo rusage;
    ASSERT_EQ(platform.pidRusage(*task, rusage), 0);
    std::string status = "/proc/" + std::to_string(fixture_->pid()) + "/status";
    uint64_t kB = procField(status, "RssAnon") + procField(status, "RssShmem") + procField(status, "VmSwap") +
                  procField(status, "VmPTE") + procField(status, "HugetlbPages");
    EXPECT_EQ(rusage.ri_phys_memspread, kB * 1024);
    EXPECT_GE(rusage.ri_lifetime_max_phys_memspread, rusage.ri_phys_memspread);
    EXPECT_GE(rusage.ri_lifetime_max_phys_memspread, procField(status, "VmHWM") * 1024);
    std::vector<int64_t> balances;
    ASSERT_EQ(platform.ledgerEntries(*task, balances), 0);
    ASSERT_EQ(balances.size(), 1u);
    EXPECT_EQ(balances[0], static_cast<int64_t>(procField(status, "VmPTE") * 1024));
    EXPECT_GT(balances[0], 0);
}

// A process that ends after memspread opened it: as a zombie (its address space reads empty)
// and once reaped (its files fail). Both read as gone, never as an empty process.
TEST(RKLinuxWalkGone, ZombieAndReapedProcessesAreGone) {
    RKLinuxPlatform platform;
    pid_t pid = ::fork();
    if (pid == 0) ::_exit(0);
    ASSERT_GT(pid, 0);
    std::unique_ptr<RKTask> task;
    ASSERT_EQ(platform.taskForPid(pid, task), KERN_SUCCESS);
    // Wait until it is a zombie without reaping it.
    siginfo_t info{};
    ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOWAIT), 0);
    Walk zombie = walk(platform, *task);
    EXPECT_TRUE(zombie.regions.empty());
    EXPECT_EQ(zombie.end, MACH_SEND_INVALID_DEST);
    RKRusageInfo rusage;
    EXPECT_NE(platform.pidRusage(*task, rusage), 0);

    ASSERT_EQ(::waitpid(pid, nullptr, 0), pid);
    Walk reaped = walk(platform, *task);
    EXPECT_TRUE(reaped.regions.empty());
    EXPECT_EQ(reaped.end, MACH_SEND_INVALID_DEST);
    uint64_t address = 0x1000, size = 0;
    RKRegionBasicInfo basic;
    EXPECT_EQ(platform.region(*task, address, size, basic), MACH_SEND_INVALID_DEST);
    EXPECT_FALSE(platform.regionFileName(*task, 0x1000));
}

// The walk on a fake /proc tree, where the test controls what the files say and when.
class RKLinuxWalkFakeTree : public ::testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/memspread-proc-XXXXXX";
        ASSERT_NE(::mkdtemp(pattern), nullptr);
        root_ = pattern;
        std::filesystem::create_directory(root_ + "/77");
        write("smaps", capture());
        write("statm", "2048 700 400 10 0 300 0\n");
        write("mountinfo", "26 1 254:0 / / rw - ext4 /dev/vda rw\n29 24 0:26 / /dev/shm rw - tmpfs tmpfs rw\n");
    }
    void TearDown() override { std::filesystem::remove_all(root_); }
    void write(const std::string& name, const std::string& text) {
        std::ofstream(root_ + "/77/" + name, std::ios::trunc) << text;
    }
    static std::string capture() {
        std::ifstream in(std::string(MEMSPREAD_TEST_DATA) + "/smaps-fixture.txt");
        std::stringstream text;
        text << in.rdbuf();
        return text.str();
    }
    std::string root_;
};

TEST_F(RKLinuxWalkFakeTree, SmapsIsReadOnceAWalkAndAgainForTheNextWalk) {
    RKLinuxPlatform platform(root_);
    std::unique_ptr<RKTask> task;
    ASSERT_EQ(platform.taskForPid(77, task), KERN_SUCCESS);
    uint64_t address = 0, size = 0;
    RKRegionSubmapInfo info;
    uint32_t count = 0;
    ASSERT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_SUCCESS);
    EXPECT_EQ(address, 0x5579ccee5000u);
    EXPECT_EQ(count, RK_REGION_SUBMAP_INFO_COUNT);

    // A new walk starts over at 0 and reads the file again.
    write("smaps", "");
    Walk again = walk(platform, *task);
    EXPECT_TRUE(again.regions.empty());
    EXPECT_EQ(again.end, MACH_SEND_INVALID_DEST);

    // The file changes under a walk in progress: the walk goes on with what it read.
    write("smaps", capture());
    address = 0;
    ASSERT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_SUCCESS);
    write("smaps", "");
    address = 0x7f8735c27000 + 1;  // inside a region: the region that contains it
    ASSERT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_SUCCESS);
    EXPECT_EQ(address, 0x7f8735c27000u);
    EXPECT_EQ(size, 0x20000u);
    address = 0x7f8735c9f000;  // in a hole left by the trimmed capture: the next region above
    ASSERT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_SUCCESS);
    EXPECT_EQ(address, 0x7f8735cc0000u);
    EXPECT_EQ(platform.regionFileName(*task, 0x7f873567a000), "/dev/shm/memspread-fixture-10862");
    EXPECT_FALSE(platform.regionFileName(*task, 0x7f8735c9f000));
    address = 0xffffffffff601000;
    EXPECT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_INVALID_ADDRESS);
}

TEST_F(RKLinuxWalkFakeTree, AProcessThatWentAwayWhileReadEndsItsWalkAsGone) {
    // statm of a process whose address space was released reads zeros: what was read is kept,
    // and the end of the walk says the process is gone.
    write("statm", "0 0 0 0 0 0 0\n");
    RKLinuxPlatform platform(root_);
    Walk gone = walk(platform, 77);
    EXPECT_EQ(gone.end, MACH_SEND_INVALID_DEST);
    std::vector<RKSmapsVma> vmas;
    std::string text = capture();
    RKParseSmaps(text, vmas);
    EXPECT_EQ(gone.regions.size(), vmas.size());

    std::filesystem::remove(root_ + "/77/statm");
    EXPECT_EQ(walk(platform, 77).end, MACH_SEND_INVALID_DEST);
    write("statm", "2048 700 400 10 0 300 0\n");
    EXPECT_EQ(walk(platform, 77).end, KERN_INVALID_ADDRESS);
}
