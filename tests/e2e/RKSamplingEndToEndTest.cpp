// Sampling mode on real processes, stopped by SIGINT as a user would: every formatter gets the
// same samples, the metrics log stays JSON Lines, targets are resolved anew at every sample (as
// every process is under -a: the same resolution).
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

// Prints the number of JSON samples, then per metrics-log line "header", "total" (ALL_PROCESSES's
// total_memory), "duration" (gather_duration) or "value"; "bad LINE" for a line that is not a
// JSON object.
const char* kSummarizeOutputs = R"(import json, sys
print("samples", len(json.load(open(sys.argv[1], encoding="utf-8"))["samples"]))
for line in open(sys.argv[2], encoding="utf-8"):
    try: record = json.loads(line)
    except ValueError: record = None
    if not isinstance(record, dict): print("bad", line.rstrip()); continue
    if "log" in record: print("header"); continue
    variables = record["variables"]
    if record["metric"] == "total_memory" and variables.get("process") == "ALL_PROCESSES": print("total")
    elif record["metric"] == "gather_duration": print("duration")
    else: print("value")
)";

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
    RKCommandResult summary = RKRunCommand({"python3", "-c", kSummarizeOutputs, json.string(), log.string()});
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

    // One text report, one JSON sample, one summary total and one duration per sample.
    const size_t samples = countOf(run.standardOutput, std::regex("(^|\n)Time: "));
    EXPECT_GE(samples, 4u);
    ASSERT_TRUE(summary.exitedWith(0)) << summary.standardError;
    const std::string& lines = summary.standardOutput;
    EXPECT_TRUE(lines.starts_with("samples " + std::to_string(samples) + "\nheader\n")) << lines;
    EXPECT_EQ(countOf(lines, std::regex("\ntotal\n")), samples);
    EXPECT_EQ(countOf(lines, std::regex("\nduration\n")), samples);
    EXPECT_EQ(lines.find("bad"), std::string::npos) << lines;
}
