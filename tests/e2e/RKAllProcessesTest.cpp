// Measuring all processes of a machine the way a busy server would put it to memspread: under a
// descriptor limit lower than the number of processes, with other processes' names full of
// control characters, and while processes come and go hundreds of times a second.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <iterator>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"
#include "support/RKUnprivileged.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

fs::path temporaryDocument(const std::string& name) {
    return fs::temp_directory_path() / ("rk-" + name + "-" + std::to_string(getpid()) + ".json");
}

// The pids of the processes in `document` that carry a memspread figure; nothing when it does not parse.
std::optional<std::set<pid_t>> measuredPids(const fs::path& document) {
    RKCommandResult parsed = RKRunCommand({"python3", "-c",
                                           "import json, sys; print(*[p['pid'] for p in json.load(open(sys.argv[1]))"
                                           "['processes'] if 'memspread' in p])",
                                           document.string()});
    std::istringstream words(parsed.standardOutput);
    if (!parsed.exitedWith(0)) return std::nullopt;
    return std::set<pid_t>(std::istream_iterator<pid_t>(words), {});
}

// Idle children of the test, killed and reaped when it ends.
struct RKIdleChildren {
    std::vector<pid_t> pids;
    ~RKIdleChildren() {
        for (pid_t pid : pids) kill(pid, SIGKILL);
        for (pid_t pid : pids) waitpid(pid, nullptr, 0);
    }
};

// A byte that a terminal could act on, other than the line ends and tabs of the report itself.
bool hasRawControl(const std::string& text) {
    return std::ranges::any_of(text, [](unsigned char c) { return (c < 0x20 && c != '\n' && c != '\t') || c == 0x7F; });
}

}  // namespace

// Under a descriptor limit of 64, every one of 300 idle children is measured; among them, an
// executable whose name clears the screen and rings the bell is named escaped, as it is on
// standard error when a user who cannot read it asks for it by name.
TEST(RKAllProcesses, EveryProcessMeasuredUnderADescriptorLimitOf64AndNoNameReachesATerminalRaw) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    const std::string name = "rk\x1b[2J\x07name";
    const fs::path directory = fs::temp_directory_path() / ("rk-names-" + std::to_string(getpid()));
    fs::create_directories(directory);
    fs::copy_file(MEMSPREAD_FIXTURE, directory / name);
    // The children first: forked later, they would hold the fixture's standard input open.
    RKIdleChildren children;
    for (pid_t pid = 0; children.pids.size() < 300 && (pid = fork()) >= 0;) {
        if (pid == 0) for (;;) pause();  // until killed
        children.pids.push_back(pid);
    }
    ASSERT_EQ(children.pids.size(), 300u);
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start((directory / name).string(), {directory.string()})) << fixture.error();
    const fs::path document = temporaryDocument("fd64");
    // Soft and hard limit alike, as `ulimit -n 64` sets them: memspread cannot raise it.
    RKCommandResult run = RKRunCommand({"prlimit", "--nofile=64:64", MEMSPREAD_BINARY, "-a", "-j", document.string()});
    RKCommandResult refused = RKRunCommand(RKAsNobody(MEMSPREAD_BINARY, {name}));
    auto measured = measuredPids(document);
    const pid_t pid = fixture.pid();
    fixture.stop();
    fs::remove_all(directory);
    fs::remove(document);

    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    ASSERT_TRUE(measured) << "the document does not parse";
    size_t found = 0;
    for (pid_t child : children.pids) found += measured->count(child);
    EXPECT_EQ(found, 300u) << run.standardError;
    EXPECT_EQ(run.standardError.find("too many open files"), std::string::npos) << run.standardError;
    EXPECT_NE(run.standardOutput.find("rk\\x1b[2J\\x07name [" + std::to_string(pid) + "]"), std::string::npos);
    EXPECT_FALSE(hasRawControl(run.standardOutput));
    EXPECT_FALSE(hasRawControl(run.standardError)) << run.standardError;
    EXPECT_NE(refused.standardError.find("Unable to analyze process rk\\x1b[2J\\x07name"), std::string::npos)
        << refused.standardError;
    EXPECT_FALSE(hasRawControl(refused.standardError));
}

// Runs -a for MEMSPREAD_CHURN_SECONDS (default 40) while the churn helper forks, execs and reaps a
// few hundred processes a second. Every run must end by itself (each is bounded) with exit 0, a
// complete report and a document that parses and holds the churning parent.
TEST(RKAllProcesses, CompleteReportWhileProcessesComeAndGo) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    const char* setting = std::getenv("MEMSPREAD_CHURN_SECONDS");
    const auto duration = std::chrono::seconds(setting ? std::atoi(setting) : 40);
    RKFixtureProcess churn;
    ASSERT_TRUE(churn.start(MEMSPREAD_CHURN)) << churn.error();
    const fs::path document = temporaryDocument("churn");
    const auto end = std::chrono::steady_clock::now() + duration;
    int runs = 0;
    while (std::chrono::steady_clock::now() < end) {
        // A run takes a second or two; the bound is for a loaded machine and only stops a hang.
        RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-a", "-j", document.string()}, 120s);
        runs++;
        ASSERT_TRUE(run.exitedWith(0)) << "run " << runs << " failed, was killed or timed out:\n" << run.standardError;
        ASSERT_NE(run.standardOutput.find("Summary Memspread:"), std::string::npos) << "run " << runs;
        auto measured = measuredPids(document);
        ASSERT_TRUE(measured) << "run " << runs << ": the document does not parse";
        EXPECT_EQ(measured->count(churn.pid()), 1u) << "run " << runs << ": the churning parent is missing";
    }
    churn.stop();
    fs::remove(document);
    std::printf("%d runs of -a in %llds of churn\n", runs, static_cast<long long>(duration.count()));
}
