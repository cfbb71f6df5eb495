// The /proc process list on a small fake proc root. (That a task reads the process it was opened
// on, every end-to-end run shows: otherwise each process would read as reused, and gone.)
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/RKLinuxPlatform.h"
#include "platform/RKProcStatParser.h"
#include "process/RKProcess.h"

namespace fs = std::filesystem;

TEST(RKProcList, ListsProcessesAfterTheKernelWithoutKernelThreadsAndDescribesEach) {
    char pattern[] = "/tmp/rk-proc-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    const fs::path root = pattern;
    fs::create_directory_symlink(root / "12", root / "self");  // not a process
    // A process whose stat file reads "PID " + `stat`; ordinary ones have flags 4194304.
    auto addProcess = [&](pid_t pid, const std::string& stat) {
        fs::create_directory(root / std::to_string(pid));
        std::ofstream(root / std::to_string(pid) / "stat") << pid << ' ' << stat << " 1 1 0 -1 4194304 0 0 0 0 20 0\n";
    };
    // exe links to root/name, which is created holding `header` unless that is empty.
    auto linkExecutable = [&](pid_t pid, const std::string& name, std::string_view header) {
        if (!header.empty()) std::ofstream(root / name) << header;
        fs::create_symlink(root / name, root / std::to_string(pid) / "exe");
    };
    addProcess(7, "(seven) S 1");
    addProcess(12, "(x) (y z) Z 7");  // a parser stopping at the first ')' reads "(y" as the state
    addProcess(100, "(kworker/0:1) I 2 0 0 0 -1 2129984");  // PF_KTHREAD, then what addProcess appends
    fs::create_directory(root / "13");
    std::ofstream(root / "13" / "stat") << "13 (cut) S";  // a process that exited mid-read
    for (pid_t pid = 20; pid <= 21; pid++) addProcess(pid, "(comm) S 1");
    linkExecutable(20, "old", std::string_view("\x7f" "ELF\x01\x01\x01\0", 8));
    linkExecutable(21, "a much longer executable name", std::string_view("\x7f" "ELF\x02\x01\x01\0", 8));
    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>(root.string()));
    RKPlatform& platform = RKPlatform::current();

    // Directory order and string order ("100" < "12" < "7") must not leak through.
    EXPECT_EQ(platform.listAllPids(), (std::vector<pid_t>{0, 7, 12, 13, 20, 21, 100}));
    auto records = RKCopyAllBsdInfo();
    ASSERT_TRUE(records);
    ASSERT_EQ(records->size(), 5u) << "kernel threads have no address space to measure";
    EXPECT_EQ((*records)[0].pbi_flags & PROC_FLAG_SYSTEM, PROC_FLAG_SYSTEM);
    EXPECT_EQ(RKProcess::_nameForBsdInfo((*records)[0]), "kernel");
    EXPECT_EQ((*records)[2].pbi_ppid, 7);
    // No readable exe (another user's process, for example): 64-bit, named from stat.
    EXPECT_EQ((*records)[2].pbi_flags, PROC_FLAG_LP64);
    EXPECT_EQ(RKProcess::_nameForBsdInfo((*records)[2]), "x) (y z");
    uint32_t status = 0;
    EXPECT_EQ(platform.shortBsdInfoStatus(12, status), 0);
    EXPECT_EQ(status, SZOMB);
    EXPECT_EQ(platform.shortBsdInfoStatus(13, status), ESRCH);
    EXPECT_EQ(platform.shortBsdInfoStatus(77, status), ESRCH);

    EXPECT_EQ(platform.bsdInfo(20)->pbi_flags & PROC_FLAG_LP64, 0u);
    EXPECT_EQ(platform.bsdInfo(21)->pbi_flags & PROC_FLAG_LP64, PROC_FLAG_LP64);
    EXPECT_EQ(RKProcess::_nameForBsdInfo(*platform.bsdInfo(21)), "a much longer executable name");
    EXPECT_FALSE(platform.executablePath(0));

    fs::remove_all(root);
    EXPECT_FALSE(platform.listAllPids()) << "an unreadable proc root is a failure";

    // The start time that tells a reused pid from the process listed under it: field 22.
    std::string line = "41 (a) b) R 1 41 41 0 -1 4194560 97 0 0 0 1 2 0 0 20 0 1 0 123456 4096 100";
    EXPECT_EQ(RKParseProcStat(line)->startTime, 123456u);
    EXPECT_EQ(RKParseProcStat("41 (a) R 1 41 41 0 -1 4194560")->startTime, 0u) << "absent: 0";
}
