// The binary up to the measurement: what the command line alone decides, what becomes of named
// output files, and which processes are targeted. Targets are copies of sleep started under names
// of their own, so that nothing else on the machine answers to them.
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <regex>
#include <set>
#include <sstream>

#include "platform/RKLinuxPlatform.h"
#include "process/RKKernelProcess.h"
#include "support/RKKeptArgv.h"
#include "support/RKRunCommand.h"
#include "support/RKUnprivileged.h"

namespace {

namespace fs = std::filesystem;
using Keys = std::set<int64_t>;

const std::string kNoTarget =
    "Unable to find any processes matching the supplied process names or pids (try as root?)\n";

RKCommandResult memspread(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), MEMSPREAD_BINARY);
    return RKRunCommand(arguments);
}

// Every `from` in `text` replaced by `to`.
std::string replaced(std::string text, const std::string& from, const std::string& to) {
    for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size())
        text.replace(at, from.size(), to);
    return text;
}

class RKDriverTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string pattern = (fs::temp_directory_path() / "memspread-e2e-XXXXXX").string();
        ASSERT_NE(mkdtemp(pattern.data()), nullptr);
        directory_ = pattern;
    }
    void TearDown() override {
        for (pid_t child : children_) kill(child, SIGKILL);
        for (pid_t child : children_) waitpid(child, nullptr, 0);
        fs::remove_all(directory_);
    }

    // A file that already holds something, as a stale report would.
    std::string existingFile(const std::string& name) {
        std::string path = (directory_ / name).string();
        std::ofstream(path) << "stale report\n";
        return path;
    }

    // Starts a copy of sleep named by the test run's tag and `suffix` (short: the kernel keeps 15
    // bytes); it runs by the time this returns.
    pid_t startSleeper(const std::string& suffix) {
        const fs::path path = directory_ / (tag_ + suffix);
        if (!fs::exists(path)) fs::copy_file("/bin/sleep", path);
        char* argv[] = {const_cast<char*>(path.c_str()), const_cast<char*>("300"), nullptr};
        pid_t pid = -1;
        EXPECT_EQ(posix_spawn(&pid, argv[0], nullptr, nullptr, argv, environ), 0) << path;
        if (pid > 0) children_.push_back(pid);
        return pid;
    }

    // Resolves a command line (without the program name) in this process, on the real /proc.
    Keys resolve(const std::vector<std::string>& arguments) {
        RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>());
        Keys keys;
        auto targets = RKParsedArgs(arguments).value().targetProcessesAndError(nullptr);
        for (const auto& [key, process] : targets.value_or(RKTargetMap{}))
            if (key != 0 || std::dynamic_pointer_cast<RKKernelProcess>(process)) keys.insert(key);
        return keys;
    }

    const std::string tag_ = "rk" + std::to_string(getpid() % 100000);
    fs::path directory_;
    std::vector<pid_t> children_;
};

}  // namespace

// Runs every command line of the data file and writes down the answers in the file's own form.
TEST_F(RKDriverTest, WhatTheCommandLineAloneDecides) {
    const std::string usage = RKFileText(MEMSPREAD_TEST_DATA "/usage.txt");  // as documented
    std::string expected;
    std::string actual;
    for (const std::string& line : RKSplitLines(RKFileText(MEMSPREAD_TEST_DATA "/driver-failures.txt"))) {
        if (line.empty() || line[0] == '#') continue;
        expected += line + "\n";
        if (line[0] != '$') continue;
        std::istringstream words(replaced(line.substr(1), "@DATA@", MEMSPREAD_TEST_DATA));
        std::vector<std::string> command = {"/usr/bin/env", MEMSPREAD_BINARY};  // NAME=VALUE words go before it
        for (std::string word; words >> word;)
            command.insert(std::regex_match(word, std::regex("[A-Z_]+=.*")) ? command.end() - 1 : command.end(), word);
        RKCommandResult result = RKRunCommand(command);
        actual += line + "\nexit " + std::to_string(result.exitStatus.value_or(-1));
        actual += result.standardOutput == usage ? " usage\n" : result.standardOutput.empty() ? "\n" : " other\n";
        for (const auto& [path, name] : {std::pair{MEMSPREAD_BINARY, "memspread"}, {MEMSPREAD_TEST_DATA, "@DATA@"}})
            result.standardError = replaced(result.standardError, path, name);
        for (const std::string& error : RKSplitLines(result.standardError))
            actual += (error.empty() ? "|" : "| " + error) + "\n";
        if (!result.standardError.empty() && result.standardError.back() != '\n') actual += "(no final newline)\n";
    }
    EXPECT_EQ(actual, expected);
}

TEST_F(RKDriverTest, FailedStartRemovesEveryNamedOutputFileAndARunReplacesThem) {
    std::string json = existingFile("out.json");
    std::string metrilog = existingFile("out.mlj");
    EXPECT_TRUE(memspread({"-j", json, "--metrilog", metrilog}).exitedWith(1));
    EXPECT_FALSE(fs::exists(json));
    EXPECT_FALSE(fs::exists(metrilog));

    // The JSON file was created before the metrics log failed; it goes too.
    RKCommandResult badLog = memspread({"-j", json, "--metrilog", directory_ / "missing" / "out.mlj", "1"});
    EXPECT_TRUE(badLog.exitedWith(1));
    EXPECT_EQ(badLog.standardError,
              "Unable to open mlwriter: No such file or directory\nUnable to create metrilog output\n");
    EXPECT_FALSE(fs::exists(json));

    // One target found is enough to run.
    existingFile("out.json");
    RKCommandResult found =
        memspread({"-j", json, "--metrilog", metrilog, std::to_string(startSleeper("run")), tag_ + "x"});
    EXPECT_TRUE(found.exitedWith(0)) << found.standardError;
    EXPECT_EQ(found.standardError, "Unable to find pid for process matching '" + tag_ + "x'\n");
    EXPECT_EQ(RKFileText(json).substr(0, 1), "{") << "a document replaces the stale report";
    EXPECT_TRUE(fs::exists(metrilog));
}

TEST_F(RKDriverTest, NamesAndSelf) {
    // Two processes of one executable answer to its whole name, neither to a part of it.
    const Keys twins = {startSleeper("twin"), startSleeper("twin")};
    EXPECT_EQ(resolve({tag_ + "twin"}), twins);
    EXPECT_EQ(resolve({tag_ + "twi"}), Keys{});

    // memspread is never its own target.
    EXPECT_EQ(resolve({"-a"}).count(getpid()), 0u);

    // A copy of the binary under a name of its own: nothing but itself answers to it.
    fs::path self = directory_ / (tag_ + "self");
    fs::copy_file(MEMSPREAD_BINARY, self);
    RKCommandResult alone = RKRunCommand({self.string(), self.filename().string()});
    EXPECT_TRUE(alone.exitedWith(1));
    EXPECT_EQ(alone.standardError, kNoTarget) << "only the summary, and no usage";
    EXPECT_EQ(alone.standardOutput, "");
}

TEST_F(RKDriverTest, AnUnprivilegedUser) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the binary as nobody";
    // -a and --unmapped need root; the directory is open to nobody, so that only the binary's own
    // refusal keeps the stale report as it was.
    std::string json = existingFile("kept.json");
    fs::permissions(directory_, fs::perms::all);
    fs::permissions(json, fs::perms::all);
    for (const std::vector<std::string>& arguments :
         {std::vector<std::string>{"--unmapped", "1"}, {"-a", "-j", json}}) {
        RKCommandResult result = RKRunCommand(RKAsNobody(MEMSPREAD_BINARY, arguments));
        EXPECT_TRUE(result.exitedWith(1)) << arguments.front();
        EXPECT_EQ(result.standardError, "Must run as root.\n") << arguments.front();
        EXPECT_EQ(result.standardOutput, "") << arguments.front();
    }
    EXPECT_EQ(RKFileText(json), "stale report\n");

    // Another user's process is left out (its name from the kernel's record is the platform
    // tests').
    std::string pid = std::to_string(startSleeper("root"));
    RKCommandResult byPid = RKRunCommand(RKAsNobody(MEMSPREAD_BINARY, {pid}));
    EXPECT_TRUE(byPid.exitedWith(1));
    EXPECT_EQ(byPid.standardError, "task_for_pid: permission denied\nUnable to analyze process with pid " + pid +
                                       " (try as root?)\n" + kNoTarget);
}
