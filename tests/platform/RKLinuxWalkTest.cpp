// The Linux region walk and per-process figures on a real process (the fixture program), on
// processes that end under it, and on a fake /proc tree.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKLinuxVmaClassifier.h"
#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"

namespace {

struct WalkedRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    RKRegionSubmapInfo info;
    std::optional<std::string> name;
};

struct Walk {
    std::vector<WalkedRegion> regions;
    kern_return_t end = KERN_FAILURE;
};

// Walks like the process layer does: from address 0, each call at the end of the last region.
Walk walk(RKPlatform& platform, RKTask& task) {
    Walk result;
    for (uint64_t address = 0;;) {
        WalkedRegion region;
        uint32_t count = 0;
        result.end = platform.regionRecurse(task, address, region.size, region.info, count);
        if (result.end != KERN_SUCCESS) return result;
        region.start = address;
        region.name = platform.regionFileName(task, address);
        result.regions.push_back(region);
        address += region.size;
    }
}

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// The sum of the "Name:  N kB" lines `names` of a /proc file, in pages.
uint64_t procPages(pid_t pid, const std::string& file, std::initializer_list<std::string> names) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/" + file);
    uint64_t kB = 0;
    for (std::string line; std::getline(in, line);)
        for (const std::string& name : names)
            if (line.starts_with(name + ":")) kB += std::stoull(line.substr(name.size() + 1));
    return kB * 1024 / P;
}

}  // namespace

// Each kind of mapping as the process layer sees it, and each process's total against the
// kernel's, are tested end to end; here the records and figures as the kernel's files tell them.
TEST(RKLinuxWalk, TheFixturesRecordsAgreeWithTheKernel) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    RKLinuxPlatform platform;
    const pid_t pid = fixture.pid();
    std::unique_ptr<RKTask> task;
    ASSERT_EQ(platform.taskForPid(pid, task), KERN_SUCCESS);
    const Walk parent = walk(platform, *task);
    ASSERT_EQ(parent.end, KERN_INVALID_ADDRESS);
    auto region = [&](const char* name) {
        auto at = [&](const WalkedRegion& region) { return region.start == fixture.area(name)->address; };
        auto found = std::find_if(parent.regions.begin(), parent.regions.end(), at);
        return found == parent.regions.end() ? WalkedRegion{} : *found;
    };
    // A mapped file is the file: its device and inode as stat tells them.
    WalkedRegion file = region("file_private");
    struct stat st {};
    ASSERT_EQ(::stat(file.name.value_or("").c_str(), &st), 0);
    EXPECT_EQ(file.info.object_id_full,
              RKObjectIdForFile(RKObjectKindFile, RKDeviceKey(major(st.st_dev), minor(st.st_dev)), st.st_ino));

    // The per-process figures are the status file's.
    RKRusageInfo rusage;
    ASSERT_EQ(platform.pidRusage(*task, rusage), 0);
    EXPECT_EQ(rusage.ri_phys_memspread,
              procPages(pid, "status", {"RssAnon", "RssShmem", "VmSwap", "VmPTE", "HugetlbPages"}) * P);
    EXPECT_GE(rusage.ri_lifetime_max_phys_memspread, procPages(pid, "status", {"VmHWM"}) * P);
    std::vector<int64_t> balances;
    ASSERT_EQ(platform.ledgerEntries(*task, balances), 0);
    EXPECT_EQ(balances, std::vector<int64_t>{static_cast<int64_t>(procPages(pid, "status", {"VmPTE"}) * P)});
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
    siginfo_t info{};
    ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOWAIT), 0);  // a zombie now
    EXPECT_EQ(walk(platform, *task).end, MACH_SEND_INVALID_DEST);
    RKRusageInfo rusage;
    EXPECT_NE(platform.pidRusage(*task, rusage), 0);

    ASSERT_EQ(::waitpid(pid, nullptr, 0), pid);
    EXPECT_EQ(walk(platform, *task).end, MACH_SEND_INVALID_DEST);
}

// The walk on a fake /proc tree, where the test controls what the files say and when.
TEST(RKLinuxWalkFakeTree, SmapsIsReadOnceAWalkAndAProcessGoneMidReadEndsItsWalkAsGone) {
    char pattern[] = "/tmp/memspread-proc-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    const std::filesystem::path root(pattern);
    std::filesystem::create_directory(root / "77");
    auto write = [&](const char* name, const std::string& text) { std::ofstream(root / "77" / name) << text; };
    const std::string capture = RKFileText(MEMSPREAD_TEST_DATA "/smaps-fixture.txt");
    write("smaps", capture);
    write("statm", "2048 700 400 10 0 300 0\n");
    RKLinuxPlatform platform(root.string());
    std::unique_ptr<RKTask> task;
    ASSERT_EQ(platform.taskForPid(77, task), KERN_SUCCESS);
    Walk first = walk(platform, *task);
    EXPECT_EQ(first.end, KERN_INVALID_ADDRESS);

    // The file changes under a walk in progress: the walk goes on with what it read, answering
    // inside a region with that region.
    uint64_t address = 0, size = 0;
    RKRegionSubmapInfo info;
    uint32_t count = 0;
    ASSERT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_SUCCESS);
    write("smaps", "");
    address = 0x7f8735c27000 + 1;
    ASSERT_EQ(platform.regionRecurse(*task, address, size, info, count), KERN_SUCCESS);
    EXPECT_EQ(address, 0x7f8735c27000u);
    EXPECT_EQ(size, 0x20000u);
    // A new walk reads the file again: empty now, as a process that exited mid-read leaves it.
    EXPECT_EQ(walk(platform, *task).end, MACH_SEND_INVALID_DEST);

    // statm of a process whose address space was released reads zeros: what was read is kept,
    // and the end of the walk says the process is gone.
    write("smaps", capture);
    write("statm", "0 0 0 0 0 0 0\n");
    Walk gone = walk(platform, *task);
    EXPECT_EQ(gone.end, MACH_SEND_INVALID_DEST);
    EXPECT_EQ(gone.regions.size(), first.regions.size());
    std::filesystem::remove_all(root);
}
