// The /proc process list on a small fake proc root.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/RKLinuxPlatform.h"
#include "process/RKProcess.h"

namespace fs = std::filesystem;

namespace {

class RKProcListTest : public ::testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/rk-proc-XXXXXX";
        ASSERT_NE(::mkdtemp(pattern), nullptr);
        root_ = pattern;
        fs::create_directory(root_ / "sys");                          // not a process
        fs::create_directory_symlink(root_ / "12", root_ / "self");  // not a number
    }
    void TearDown() override { fs::remove_all(root_); }

    void addProcess(pid_t pid, const std::string& comm, char state, pid_t ppid, unsigned flags = 4194304) {
        fs::create_directory(root_ / std::to_string(pid));
        std::ofstream(root_ / std::to_string(pid) / "stat")
            << pid << " (" << comm << ") " << state << ' ' << ppid << " 1 1 0 -1 " << flags << " 0 0 0 0 20 0 1 0\n";
    }
    // exe links to root/name, which is created holding `header` unless that is empty.
    void linkExecutable(pid_t pid, const std::string& name, std::string_view header) {
        if (!header.empty()) std::ofstream(root_ / name) << header;
        fs::create_symlink(root_ / name, root_ / std::to_string(pid) / "exe");
    }

    fs::path root_;
};

}  // namespace

TEST_F(RKProcListTest, ListsProcessesAfterTheKernelWithoutKernelThreads) {
    addProcess(7, "seven", 'S', 1);
    addProcess(12, "short comm", 'Z', 7);
    addProcess(100, "kworker/0:1", 'I', 2, 0x00208040);
    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>(root_.string()));
    RKPlatform& platform = RKPlatform::current();

    // Directory order and string order ("100" < "12" < "7") must not leak through.
    EXPECT_EQ(platform.listAllPids(), (std::vector<pid_t>{0, 7, 12, 100}));
    auto records = RKCopyAllBsdInfo();
    ASSERT_TRUE(records);
    ASSERT_EQ(records->size(), 3u) << "kernel threads have no address space to measure";
    EXPECT_EQ((*records)[0].pbi_flags & PROC_FLAG_SYSTEM, PROC_FLAG_SYSTEM);
    EXPECT_EQ(RKProcess::_nameForBsdInfo((*records)[0]), "kernel");
    EXPECT_EQ((*records)[2].pbi_ppid, 7);
    // No readable exe (another user's process, for example): 64-bit, named from stat.
    EXPECT_EQ((*records)[2].pbi_flags, PROC_FLAG_LP64);
    EXPECT_EQ(RKProcess::_nameForBsdInfo((*records)[2]), "short comm");

    uint32_t status = 0;
    EXPECT_EQ(platform.shortBsdInfoStatus(12, status), 0);
    EXPECT_EQ(status, SZOMB);
    EXPECT_EQ(platform.shortBsdInfoStatus(77, status), ESRCH);
    fs::remove_all(root_);
    EXPECT_FALSE(platform.listAllPids()) << "an unreadable proc root is a failure";
}

TEST_F(RKProcListTest, ExecutableClassAndPath) {
    addProcess(20, "old", 'S', 1);
    addProcess(21, "new", 'S', 1);
    addProcess(22, "gone", 'S', 1);
    addProcess(23, "odd", 'S', 1);
    linkExecutable(20, "old", std::string_view("\x7f" "ELF\x01\x01\x01\0", 8));
    linkExecutable(21, "a much longer executable name", std::string_view("\x7f" "ELF\x02\x01\x01\0", 8));
    linkExecutable(22, "my tool (deleted)", "");  // the kernel's link of an unlinked file
    linkExecutable(23, "odd (deleted)", "#!/bin/sh\n");  // still linked under that name
    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>(root_.string()));
    RKPlatform& platform = RKPlatform::current();

    EXPECT_EQ(platform.bsdInfo(20)->pbi_flags & PROC_FLAG_LP64, 0u);
    EXPECT_EQ(platform.bsdInfo(21)->pbi_flags & PROC_FLAG_LP64, PROC_FLAG_LP64);
    EXPECT_EQ(RKProcess::_nameForBsdInfo(*platform.bsdInfo(21)), "a much longer executable name");
    EXPECT_EQ(platform.executablePath(22), (root_ / "my tool").string());
    EXPECT_EQ(platform.executablePath(23), (root_ / "odd (deleted)").string());
    EXPECT_FALSE(platform.executablePath(0));
}
