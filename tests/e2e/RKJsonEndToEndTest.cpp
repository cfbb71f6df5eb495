// The JSON document of a real measurement: a fixture process and its child, which share memory,
// measured with -j. The document must parse, agree with the text report figure for figure, and
// record the memory the two processes share.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <regex>
#include <set>
#include <sstream>
#include <string>

#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"

namespace fs = std::filesystem;

// Prints "PID MEMSPREAD" per process object, then "shared PID PID..." per shared record.
static const char* kSummarizeDocument = R"(import json, sys
document = json.load(open(sys.argv[1], encoding="utf-8"))
for process in document["processes"]: print(process["pid"], process.get("memspread", -1))
for record in document["shared"]: print("shared", *record["pids"])
)";

TEST(RKJsonEndToEnd, DocumentAgreesWithTheTextReportAndHoldsTheSharedGroup) {
    const fs::path directory = fs::temp_directory_path() / ("rkjson-e2e-" + std::to_string(getpid()));
    fs::create_directories(directory);
    struct RemoveOnExit {
        fs::path path;
        ~RemoveOnExit() { fs::remove_all(path); }
    } cleanup{directory};
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE, {directory.string()})) << fixture.error();
    const pid_t parent = fixture.pid(), child = fixture.childPid();
    const std::string document = (directory / "out.json").string();
    RKCommandResult run = RKRunCommand(
        {MEMSPREAD_BINARY, "-f", "bytes", "-j", document, std::to_string(parent), std::to_string(child)});
    fixture.stop();
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    RKCommandResult parsed = RKRunCommand({"python3", "-c", kSummarizeDocument, document});
    ASSERT_TRUE(parsed.exitedWith(0)) << "the document does not parse: " << parsed.standardError;

    std::map<pid_t, long long> jsonFigures, textFigures;
    std::set<std::set<pid_t>> sharedGroups;
    for (const std::string& line : RKSplitLines(parsed.standardOutput)) {
        std::istringstream fields(line);
        if (line.starts_with("shared ")) {
            std::string word;
            std::set<pid_t> pids;
            fields >> word;
            for (pid_t pid; fields >> pid;) pids.insert(pid);
            sharedGroups.insert(pids);
        } else {
            pid_t pid = 0;
            fields >> pid >> jsonFigures[pid];
        }
    }
    // The text report's header names the pid ("name [PID]: 64-bit"); the memspread line follows
    // it, or follows its warning lines.
    static const std::regex header(R"(\[(\d+)\]: (32|64)-bit)"), total(R"(\tMemspread: (-?\d+) B \()");
    pid_t current = -1;
    for (const std::string& line : RKSplitLines(run.standardOutput)) {
        std::smatch match;
        if (std::regex_search(line, match, header)) current = std::stoi(match[1]);
        if (std::regex_search(line, match, total)) textFigures[current] = std::stoll(match[1]);
    }

    EXPECT_EQ(jsonFigures, textFigures) << run.standardOutput;
    ASSERT_EQ(jsonFigures.count(parent), 1u);
    EXPECT_GT(jsonFigures[parent], 0) << "the fixture wrote private memory of its own";
    EXPECT_EQ(jsonFigures.count(child), 1u);
    EXPECT_EQ(sharedGroups.count({parent, child}), 1u) << "no shared record of the parent and its child";
}
