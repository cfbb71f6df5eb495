// Target selection on real processes that the tests start: copies of sleep under names of their
// own, so that nothing else on the machine answers to them.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <filesystem>
#include <set>
#include <thread>

#include "driver/RKMemspreadArgs.h"
#include "platform/RKLinuxPlatform.h"
#include "process/RKKernelProcess.h"
#include "support/RKRunCommand.h"

namespace fs = std::filesystem;

namespace {

using Keys = std::set<int64_t>;

// Waits until `pid` runs `path`: a fork that has not exec'd yet still bears its parent's name.
bool waitForExec(pid_t pid, const std::string& path) {
    for (int i = 0; i < 500; i++) {
        std::error_code error;
        if (fs::read_symlink("/proc/" + std::to_string(pid) + "/exe", error) == path) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

class RKTargetSelectionTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string pattern = (fs::temp_directory_path() / "rkts-XXXXXX").string();
        ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
        directory_ = pattern;
    }
    void TearDown() override {
        for (pid_t group : groups_) ::kill(-group, SIGKILL);
        for (pid_t group : groups_) ::waitpid(group, nullptr, 0);
        fs::remove_all(directory_);
    }

    // A copy of sleep named by the test run's tag and `suffix` (short: the kernel keeps 15 bytes).
    std::string sleeper(const std::string& suffix) {
        fs::path path = directory_ / (tag_ + suffix);
        if (!fs::exists(path)) fs::copy_file("/bin/sleep", path);
        return path.string();
    }

    // Runs `argv` in a process group of its own, standard output to `output` when given.
    pid_t start(const std::vector<std::string>& argv, int output = -1) {
        std::vector<char*> pointers;
        for (const auto& argument : argv) pointers.push_back(const_cast<char*>(argument.c_str()));
        pointers.push_back(nullptr);
        pid_t pid = ::fork();
        if (pid == 0) {
            ::setpgid(0, 0);
            if (output >= 0) ::dup2(output, STDOUT_FILENO);
            ::execv(pointers[0], pointers.data());
            ::_exit(127);
        }
        ::setpgid(pid, pid);
        groups_.push_back(pid);
        return pid;
    }

    pid_t startSleeper(const std::string& suffix) {
        std::string path = sleeper(suffix);
        pid_t pid = start({path, "300"});
        EXPECT_TRUE(waitForExec(pid, path)) << path;
        return pid;
    }

    // Resolves a command line (without the program name) in this process, on the real /proc.
    Keys resolve(std::vector<std::string> arguments, RKError* error = nullptr) {
        RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>());
        arguments.insert(arguments.begin(), "memspread");
        std::vector<char*> argv;
        for (auto& argument : arguments) argv.push_back(argument.data());
        argv.push_back(nullptr);
        auto args = RKMemspreadArgs::initWithArgc(static_cast<int>(arguments.size()), argv.data());
        auto map = args ? args->targetProcessesAndError(error) : std::nullopt;
        Keys keys;
        for (const auto& [key, process] : map.value_or(RKTargetMap{}))
            if (key != 0 || std::dynamic_pointer_cast<RKKernelProcess>(process)) keys.insert(key);
        return keys;
    }

    const std::string tag_ = "rk" + std::to_string(::getpid() % 100000);
    fs::path directory_;
    std::vector<pid_t> groups_;
};

}  // namespace

TEST_F(RKTargetSelectionTest, NamesMatchEveryProcessExactlyAndTheKernel) {
    pid_t first = startSleeper("twin");
    pid_t second = startSleeper("twin");
    EXPECT_EQ(resolve({tag_ + "twin"}), (Keys{first, second}));
    EXPECT_EQ(resolve({tag_ + "twi"}), Keys{}) << "no prefix matching";

    std::string upper = tag_ + "TWIN";
    RKError error;
    EXPECT_EQ(resolve({upper}, &error), Keys{});
    EXPECT_EQ(error.localizedDescription, "Unable to find pid for process matching '" + upper + "'");
    EXPECT_EQ(resolve({"0"}), Keys{0});
    EXPECT_EQ(resolve({"kernel"}), Keys{0});
}

TEST_F(RKTargetSelectionTest, ExecutablesDeletedRenamedOrWithSpaces) {
    pid_t deleted = startSleeper("gone");
    pid_t renamed = startSleeper("before");
    pid_t spaced = startSleeper(" a ) b");
    fs::remove(sleeper("gone"));
    fs::rename(sleeper("before"), directory_ / (tag_ + "after"));

    RKScopedPlatform scope(std::make_shared<RKLinuxPlatform>());
    auto nameOf = [](pid_t pid) { return RKProcess::_nameForBsdInfo(*RKPlatform::current().bsdInfo(pid)); };
    EXPECT_EQ(nameOf(deleted), tag_ + "gone");
    EXPECT_EQ(nameOf(renamed), tag_ + "after");
    EXPECT_EQ(nameOf(spaced), tag_ + " a ) b");
    EXPECT_EQ(RKPlatform::current().bsdInfo(spaced)->pbi_ppid, ::getpid());
    EXPECT_EQ(resolve({tag_ + " a ) b", tag_ + "after"}), (Keys{spaced, renamed}));
}

TEST_F(RKTargetSelectionTest, ChildrenExclusionsAndSelf) {
    // sh -> (sleeper, sh -> sleeper). The shells print what they start: "s" for the inner shell,
    // "c" and "g" for the child and grandchild sleepers.
    std::string path = sleeper("child");
    int pipeFds[2];
    ASSERT_EQ(::pipe(pipeFds), 0);
    pid_t shell = start({"/bin/sh", "-c",
                         "\"$0\" 300 & echo c $!; sh -c '\"$0\" 300 & echo g $!; wait' \"$0\" & echo s $!; wait", path},
                        pipeFds[1]);
    ::close(pipeFds[1]);
    std::string text;
    char buffer[256];
    for (ssize_t n; std::count(text.begin(), text.end(), '\n') < 3 && (n = ::read(pipeFds[0], buffer, sizeof buffer)) > 0;)
        text.append(buffer, static_cast<size_t>(n));
    ::close(pipeFds[0]);
    Keys tree{shell};
    for (const std::string& line : RKSplitLines(text)) {
        pid_t pid = std::stoi(line.substr(2));
        tree.insert(pid);
        if (line[0] != 's') {
            EXPECT_TRUE(waitForExec(pid, path)) << line;
        }
    }
    ASSERT_EQ(tree.size(), 4u) << text;

    EXPECT_EQ(resolve({"-t", std::to_string(shell)}), tree);
    // -x takes a named target away, but not a descendant that -t brings back.
    EXPECT_EQ(resolve({tag_ + "child", "-x", tag_ + "child"}), Keys{});
    EXPECT_EQ(resolve({"-t", std::to_string(shell), "-x", tag_ + "child"}), tree);

    // memspread is never its own target: not by pid, and not with -a.
    EXPECT_EQ(resolve({"--pid", std::to_string(::getpid())}), Keys{});
    Keys all = resolve({"-a"});
    EXPECT_EQ(all.count(::getpid()), 0u);
    EXPECT_TRUE(std::includes(all.begin(), all.end(), tree.begin(), tree.end()));
    EXPECT_EQ(all.count(0), 1u);
}

TEST_F(RKTargetSelectionTest, MessagesOfTheBinary) {
    // A copy of memspread under a name of its own, so that parallel runs cannot answer to it.
    fs::path self = directory_ / (tag_ + "self");
    fs::copy_file(MEMSPREAD_BINARY, self);
    RKCommandResult result = RKRunCommand({self.string(), self.filename().string()});
    EXPECT_TRUE(result.exitedWith(1));
    EXPECT_EQ(result.standardError,
              "Unable to find any processes matching the supplied process names or pids (try as root?)\n");

    startSleeper("case");
    result = RKRunCommand({MEMSPREAD_BINARY, tag_ + "case", tag_ + "Case"});
    EXPECT_NE(result.standardError.find("Unable to find pid for process matching '" + tag_ + "Case'\n"),
              std::string::npos)
        << result.standardError;
}

TEST_F(RKTargetSelectionTest, AnotherUsersProcessIsLeftOut) {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to start a process that nobody cannot read";
    std::string pid = std::to_string(startSleeper("root"));
    auto asNobody = [](const std::string& target) {
        return RKRunCommand({"setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups", MEMSPREAD_BINARY, target});
    };
    const std::string none = "Unable to find any processes matching the supplied process names or pids (try as root?)\n";

    RKCommandResult byPid = asNobody(pid);
    if (!byPid.started) GTEST_SKIP() << "setpriv is not installed";
    EXPECT_TRUE(byPid.exitedWith(1));
    EXPECT_EQ(byPid.standardError, "task_for_pid: permission denied\n"
                                   "Unable to analyze process with pid " + pid + " (try as root?)\n" + none);
    // Without access to the executable the name comes from the kernel's record.
    RKCommandResult byName = asNobody(tag_ + "root");
    EXPECT_TRUE(byName.exitedWith(1));
    EXPECT_EQ(byName.standardError, "task_for_pid: permission denied\n"
                                    "Unable to analyze process " + tag_ + "root [" + pid + "] (try as root?)\n" + none);
}
