// Sampling mode on real processes, stopped by SIGINT as a user would: every formatter gets the
// same samples, and targets are resolved anew at every sample (under -a as well: the same call).
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <iterator>
#include <regex>
#include <string>
#include <thread>

#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"

namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

fs::path temporary(const std::string& name) {
    return fs::temp_directory_path() / ("rksampling-" + std::to_string(getpid()) + "-" + name);
}

size_t countOf(const std::string& text, const std::regex& pattern) {
    return static_cast<size_t>(std::distance(std::sregex_iterator(text.begin(), text.end(), pattern), {}));
}

// Samples finished in the metrics log at `path`, which is written sample by sample.
size_t samplesIn(const fs::path& path) {
    return countOf(RKFileText(path), std::regex("\"gather_duration\""));
}

// Waits until the log holds `count` samples; false after a minute (a loaded machine is slow, not
// that slow). With the minute memspread is given to finish after SIGINT, a test ends in three.
bool waitForSamples(const fs::path& log, size_t count) {
    for (int i = 0; i < 6000 && samplesIn(log) < count; i++) std::this_thread::sleep_for(10ms);
    return samplesIn(log) >= count;
}

}  // namespace

TEST(RKSamplingEndToEnd, StopsOnSigintWithTheSameSamplesInEveryOutputAndDropsAnExitedTarget) {
    const fs::path json = temporary("out.json"), log = temporary("out.mlj");
    RKFixtureProcess staying, leaving;
    ASSERT_TRUE(staying.start(MEMSPREAD_FIXTURE)) << staying.error();
    ASSERT_TRUE(leaving.start(MEMSPREAD_FIXTURE)) << leaving.error();
    const std::string gone = std::to_string(leaving.pid());
    RKCommandResult run = RKRunCommand(
        {MEMSPREAD_BINARY, "--sample", "0.25", "-j", json.string(), "--metrilog", log.string(),
         std::to_string(staying.pid()), gone},
        60s, [&](pid_t memspread) {
            // About two seconds on an idle machine. Two samples after the exit make sure that one
            // was gathered wholly after it.
            waitForSamples(log, 2);
            leaving.stop();
            waitForSamples(log, std::max<size_t>(4, samplesIn(log) + 2));
            kill(memspread, SIGINT);
        });
    staying.stop();
    RKCommandResult inJson = RKRunCommand(
        {"python3", "-c", "import json, sys; print(len(json.load(open(sys.argv[1]))['samples']))", json.string()});
    const size_t inLog = samplesIn(log);
    fs::remove(json);
    fs::remove(log);

    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    EXPECT_TRUE(run.standardError.starts_with("Sampling at 0.25s interval... (<ctrl-c> to stop)\n"))
        << run.standardError;
    EXPECT_TRUE(run.standardError.ends_with("\nStopping...\nAnalyzing and writing output...\n")) << run.standardError;
    // The exited target is reported at every sample after it left, and measured in none of them.
    EXPECT_GE(countOf(run.standardError, std::regex("Unable to analyze process (with pid " + gone + "|.* \\[" + gone +
                                                    "\\]) \\(try as root\\?\\)\n")),
              1u)
        << run.standardError;
    EXPECT_NE(run.standardOutput.find("[" + gone + "]:"), std::string::npos) << "measured before it left";
    EXPECT_EQ(run.standardOutput.substr(run.standardOutput.rfind("Time: ")).find("[" + gone + "]"), std::string::npos)
        << "measured in the last sample";

    // One text report, one JSON sample and one sample of the metrics log per sample (what each
    // holds is the formatters' own tests').
    const size_t samples = countOf(run.standardOutput, std::regex("(^|\n)Time: "));
    EXPECT_GE(samples, 4u);
    EXPECT_EQ(inJson.standardOutput, std::to_string(samples) + "\n") << inJson.standardError;
    EXPECT_EQ(inLog, samples);
}
