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

namespace {

// Prints "process PID MEMSPREAD" per process object and "shared PID PID..." per shared record.
const char* kSummarizeDocument = R"(import json, sys
document = json.load(open(sys.argv[1], encoding="utf-8"))
for process in document["processes"]:
    print("process", process["pid"], process.get("memspread", -1))
for record in document["shared"]:
    print("shared", *record["pids"])
)";

// pid -> memspread in bytes from the text report's process headers (-f bytes). The memspread
// line follows the header line, or its warning lines when there are any.
std::map<pid_t, long long> textMemspreads(const std::string& report) {
    static const std::regex header(R"(\[(\d+)\]: (32|64)-bit)");
    static const std::regex total(R"(\tMemspread: (-?\d+) B \()");
    std::map<pid_t, long long> figures;
    pid_t current = -1;
    for (const std::string& line : RKSplitLines(report)) {
        std::smatch match;
        if (std::regex_search(line, match, header)) current = std::stoi(match[1]);
        if (std::regex_search(line, match, total) && current != -1) figures[current] = std::stoll(match[1]);
    }
    return figures;
}

}  // namespace

TEST(RKJsonEndToEnd, DocumentAgreesWithTheTextReportAndHoldsTheSharedGroup) {
    const fs::path directory = fs::temp_directory_path() / ("rkjson-e2e-" + std::to_string(getpid()));
    fs::create_directories(directory);
    struct RemoveOnExit {
        fs::path path;
        ~RemoveOnExit() {
            std::error_code ignored;
            fs::remove_all(path, ignored);
        }
    } cleanup{directory};
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE, {directory.string()})) << fixture.error();
    const std::string document = (directory / "out.json").string();
    const pid_t parent = fixture.pid();
    const pid_t child = fixture.childPid();

    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-j", document,
                                        std::to_string(parent), std::to_string(child)});
    fixture.stop();
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;

    RKCommandResult parsed = RKRunCommand({"python3", "-c", kSummarizeDocument, document});
    ASSERT_TRUE(parsed.exitedWith(0)) << "the document does not parse: " << parsed.standardError;

    std::map<pid_t, long long> jsonFigures;
    std::set<std::set<pid_t>> sharedGroups;
    for (const std::string& line : RKSplitLines(parsed.standardOutput)) {
        std::istringstream fields(line);
        std::string kind;
        fields >> kind;
        if (kind == "process") {
            pid_t pid;
            long long memspread;
            fields >> pid >> memspread;
            jsonFigures[pid] = memspread;
        } else {
            std::set<pid_t> pids;
            for (pid_t pid; fields >> pid;) pids.insert(pid);
            sharedGroups.insert(pids);
        }
    }

    const std::map<pid_t, long long> textFigures = textMemspreads(run.standardOutput);
    EXPECT_EQ(jsonFigures, textFigures) << run.standardOutput;
    ASSERT_EQ(jsonFigures.count(parent), 1u);
    ASSERT_EQ(jsonFigures.count(child), 1u);
    // The fixture wrote private anonymous memory of its own.
    EXPECT_GT(jsonFigures[parent], 0);
    EXPECT_EQ(sharedGroups.count({parent, child}), 1u)
        << "no shared record of the parent and its child";
}
