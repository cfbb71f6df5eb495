// Snapshots end to end: `vmsnap` saves stopped fixture processes and memspread reports the files
// exactly as it reports the processes; processes the user may not read end in a clear message
// and status 1 without a file left behind.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <regex>

#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"
#include "support/RKUnprivileged.h"

namespace fs = std::filesystem;

namespace {

class RKVmsnapEndToEnd : public ::testing::Test {
protected:
    void SetUp() override {
        directory_ = fs::temp_directory_path() / ("memspread-vmsnap-" + std::to_string(getpid()));
        fs::create_directories(directory_);
        ::chmod(directory_.c_str(), 0755);
    }
    void TearDown() override { fs::remove_all(directory_); }
    fs::path directory_;
};

std::string withoutVmsnapMarks(const std::string& report) { return std::regex_replace(report, std::regex(" \\(vmsnap\\)"), ""); }

// Stops a process for the life of the object, so that two measurements see the same memory.
struct Stopped {
    explicit Stopped(std::vector<pid_t> pids) : pids_(std::move(pids)) {
        for (pid_t pid : pids_) ::kill(pid, SIGSTOP);
    }
    ~Stopped() {
        for (pid_t pid : pids_) ::kill(pid, SIGCONT);
    }
    std::vector<pid_t> pids_;
};

}  // namespace

TEST_F(RKVmsnapEndToEnd, SavedStoppedProcessesReportLikeTheLiveOnes) {
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    const std::string parent = std::to_string(fixture.pid()), child = std::to_string(fixture.childPid());
    Stopped stopped({fixture.pid(), fixture.childPid()});

    const std::string one = (directory_ / "parent.vmsnap").string();
    ASSERT_TRUE(RKRunCommand({VMSNAP_BINARY, "-o", one, parent}).exitedWith(0));
    EXPECT_EQ(withoutVmsnapMarks(RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", one}).standardOutput),
              RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", parent}).standardOutput);
    // Both in a directory: their shared memory (the memfd among it) in their pair's group.
    const fs::path pair = directory_ / "pair";
    RKCommandResult saved = RKRunCommand({VMSNAP_BINARY, "-o", pair.string(), parent, child});
    ASSERT_TRUE(saved.exitedWith(0)) << saved.standardError;
    std::vector<std::string> files;
    for (const auto& entry : fs::directory_iterator(pair)) files.push_back(entry.path().string());
    ASSERT_EQ(files.size(), 2u);
    RKCommandResult live = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-v", parent, child});
    std::vector<std::string> arguments = {MEMSPREAD_BINARY, "-f", "bytes", "-v"};
    arguments.insert(arguments.end(), files.begin(), files.end());
    RKCommandResult fromFile = RKRunCommand(arguments);
    ASSERT_TRUE(fromFile.exitedWith(0)) << fromFile.standardError;
    EXPECT_NE(fromFile.standardOutput.find("[" + parent + "] (vmsnap): 64-bit"), std::string::npos);
    EXPECT_EQ(withoutVmsnapMarks(fromFile.standardOutput), live.standardOutput);
    EXPECT_NE(fromFile.standardOutput.find("memfd memspread-fixture"), std::string::npos);
}

// Bad files are in tests/data/driver-failures.txt; here what another user may not save.
TEST_F(RKVmsnapEndToEnd, ForbiddenProcessesEndInAMessageAndStatus1) {
    if (geteuid() != 0) GTEST_SKIP() << "needs another user";
    const std::string target = (directory_ / "init.vmsnap").string();
    RKCommandResult run = RKRunCommand(RKAsNobody(VMSNAP_BINARY, {"-o", target, "1"}));
    EXPECT_TRUE(run.exitedWith(1));
    EXPECT_NE(run.standardError.find("Unable to analyze process with pid 1 (try as root?)"), std::string::npos)
        << run.standardError;
    EXPECT_FALSE(fs::exists(target));
    run = RKRunCommand(RKAsNobody(VMSNAP_BINARY, {"-a", "-o", directory_.string()}));
    EXPECT_TRUE(run.exitedWith(1));
    EXPECT_EQ(run.standardError, "vmsnap: -a needs root\n");
}
