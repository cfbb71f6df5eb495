// The run driver's failures before any measurement: what reaches standard output and standard
// error, the exit status, and what happens to named output files.
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "support/RKRunCommand.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;

const std::string kMissingDirectory = "/nonexistent-memspread-test-dir";
const std::string kJSONFailure =
    "Unable to open JSON writer: No such file or directory\nUnable to create JSON output\n";

RKCommandResult memspread(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), MEMSPREAD_BINARY);
    return RKRunCommand(arguments);
}

const std::string& usage() {
    static const std::string text = memspread({"-h"}).standardOutput;
    return text;
}

class RKDriverFailure : public testing::Test {
protected:
    void SetUp() override {
        std::string pattern = (fs::temp_directory_path() / "memspread-driver-XXXXXX").string();
        ASSERT_NE(mkdtemp(pattern.data()), nullptr);
        directory_ = pattern;
    }
    void TearDown() override { fs::remove_all(directory_); }

    // A file that already holds something, as a stale report would.
    std::string existingFile(const std::string& name) {
        std::string path = (directory_ / name).string();
        std::ofstream(path) << "stale report\n";
        return path;
    }

    fs::path directory_;
};

}  // namespace

TEST_F(RKDriverFailure, HelpPrintsOnlyTheUsage) {
    for (const char* help : {"-h", "--help"}) {
        RKCommandResult result = memspread({"-v", help, "--sort", "bad"});
        EXPECT_TRUE(result.exitedWith(0)) << help;
        EXPECT_EQ(result.standardError, "") << help;
        EXPECT_EQ(result.standardOutput, usage()) << help;
    }
    std::vector<std::string> lines = RKSplitLines(usage());
    ASSERT_EQ(lines.size(), 17u);
    EXPECT_EQ(lines.front(), "Gather memory information about a process or set of processes");
    EXPECT_EQ(usage().back(), '\n');
}

TEST_F(RKDriverFailure, ArgumentErrorsPrintTheirDescriptionThenTheUsage) {
    const std::string sortList = "Accepted arguments: dirty, swapped, clean, reclaimable, wired, regions, category";
    const std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
        {{}, "Must specify at least one process or vmsnap"},
        {{"-s", "-v"}, "Must specify at least one process or vmsnap"},
        {{"-f", "Bytes", "1"}, "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'."},
        {{"--sort", "size", "1"}, "Unrecognized argument 'size' to --sort.\n" + sortList},
        {{"--pid", "abc"}, "'abc' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process name."},
        {{"--sample", "0", "1"}, "Invalid sampling interval '0'"},
        {{"--sample", "-1", "1"}, "Invalid sampling interval '-1'"},
        {{"--sample", "abc", "1"}, "Invalid sampling interval 'abc'"},
        {{"--sample", "inf", "1"}, "Invalid sampling interval 'inf'"},
    };
    for (const auto& [arguments, description] : cases) {
        RKCommandResult result = memspread(arguments);
        std::string line = arguments.empty() ? "(none)" : arguments.front();
        EXPECT_TRUE(result.exitedWith(1)) << line;
        EXPECT_EQ(result.standardError, description + "\n") << line;
        EXPECT_EQ(result.standardOutput, usage()) << line;
    }

    // The option parser speaks for itself; the driver adds only the usage.
    for (const std::vector<std::string>& arguments : {std::vector<std::string>{"-q"}, {"1", "-j"}}) {
        RKCommandResult result = memspread(arguments);
        EXPECT_TRUE(result.exitedWith(1)) << arguments.front();
        EXPECT_NE(result.standardError.find("memspread"), std::string::npos) << result.standardError;
        EXPECT_EQ(RKSplitLines(result.standardError).size(), 1u) << result.standardError;
        EXPECT_EQ(result.standardOutput, usage()) << arguments.front();
    }
}

// An unopenable JSON file stops the run right after parsing, which shows what parsing accepted
// and printed without measuring anything.
TEST_F(RKDriverFailure, ParserNoticesComeBeforeTheRun) {
    std::string badJSON = kMissingDirectory + "/out.json";
    for (const std::vector<std::string>& accepted :
         {std::vector<std::string>{"--sample", "0.25", "1"}, {"--pid", "42x"}, {"-p", "abc", "-w", "-f", "pages"}}) {
        std::vector<std::string> arguments = accepted;
        arguments.insert(arguments.end(), {"-j", badJSON});
        RKCommandResult result = memspread(arguments);
        EXPECT_TRUE(result.exitedWith(1)) << accepted.front();
        EXPECT_EQ(result.standardError, kJSONFailure) << accepted.front();
        EXPECT_EQ(result.standardOutput, "") << accepted.front();
    }

    RKCommandResult warned = memspread({"--vmObjectDirty", "--unmapped", "-y", "-j", badJSON, "1"});
    EXPECT_EQ(warned.standardError,
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n"
              "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
              "support unmapped owned VM objects\n" + kJSONFailure);

    RKCommandResult noticed = memspread({"-a", "--unmapped", "-j", badJSON});
    std::string notice = "NOTICE: '--unmapped' is redundant when using -a/--all\n";
    EXPECT_EQ(noticed.standardError, notice + (geteuid() == 0 ? kJSONFailure : "Must run as root.\n"));
}

TEST_F(RKDriverFailure, AllAndUnmappedNeedRoot) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the binary as nobody";
    std::string json = existingFile("kept.json");
    for (const std::vector<std::string>& arguments :
         {std::vector<std::string>{"-a"}, {"--unmapped", "1"}, {"-a", "-j", json}}) {
        std::vector<std::string> command = {"setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups",
                                            MEMSPREAD_BINARY};
        command.insert(command.end(), arguments.begin(), arguments.end());
        RKCommandResult result = RKRunCommand(command);
        EXPECT_TRUE(result.exitedWith(1)) << arguments.front();
        EXPECT_EQ(result.standardError, "Must run as root.\n") << arguments.front();
        EXPECT_EQ(result.standardOutput, "") << arguments.front();
    }
    std::ifstream kept(json);
    std::string content((std::istreambuf_iterator<char>(kept)), std::istreambuf_iterator<char>());
    EXPECT_EQ(content, "stale report\n") << "a refused start must not touch output files";
}

TEST_F(RKDriverFailure, FailedStartRemovesEveryNamedOutputFile) {
    std::string json = existingFile("out.json");
    std::string metrilog = existingFile("out.mlj");

    RKCommandResult noTarget = memspread({"-j", json, "--metrilog", metrilog});
    EXPECT_TRUE(noTarget.exitedWith(1));
    EXPECT_EQ(noTarget.standardOutput, usage());
    EXPECT_FALSE(fs::exists(json));
    EXPECT_FALSE(fs::exists(metrilog));

    // The JSON file was created before the metrics log failed; it goes too.
    RKCommandResult badLog = memspread({"-j", json, "--metrilog", kMissingDirectory + "/out.mlj", "1"});
    EXPECT_TRUE(badLog.exitedWith(1));
    EXPECT_EQ(badLog.standardError,
              "Unable to open mlwriter: No such file or directory\nUnable to create metrilog output\n");
    EXPECT_FALSE(fs::exists(json));

    // Nothing matched: the resolver's own complaint is not printed, and neither is the usage.
    existingFile("out.json");
    RKCommandResult nothing = memspread({"-j", json, "no-such-process-memspread-test"});
    EXPECT_TRUE(nothing.exitedWith(1));
    EXPECT_EQ(nothing.standardError,
              "Unable to find any processes matching the supplied process names or pids (try as root?)\n");
    EXPECT_EQ(nothing.standardOutput, "");
    EXPECT_FALSE(fs::exists(json));
}

TEST_F(RKDriverFailure, RunWithSomeTargetsFoundKeepsItsOutputFiles) {
    pid_t sleeper = -1;
    char* sleepArgv[] = {const_cast<char*>("sleep"), const_cast<char*>("60"), nullptr};
    ASSERT_EQ(posix_spawnp(&sleeper, "sleep", nullptr, nullptr, sleepArgv, environ), 0);
    std::string json = existingFile("out.json");
    std::string metrilog = (directory_ / "out.mlj").string();

    RKCommandResult result =
        memspread({"-j", json, "--metrilog", metrilog, std::to_string(sleeper), "no-such-process-memspread-test"});
    kill(sleeper, SIGKILL);
    waitpid(sleeper, nullptr, 0);
    EXPECT_TRUE(result.exitedWith(0)) << result.standardError;
    EXPECT_EQ(result.standardError, "Unable to find pid for process matching 'no-such-process-memspread-test'\n");
    EXPECT_TRUE(fs::exists(json));
    EXPECT_TRUE(fs::exists(metrilog));
    std::ifstream written(json);
    std::string firstLine;
    std::getline(written, firstLine);
    EXPECT_NE(firstLine, "stale report") << "the old content must be replaced";
}
