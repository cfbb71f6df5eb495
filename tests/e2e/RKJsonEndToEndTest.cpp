// The JSON document of a real measurement: a fixture process and its child, which share memory,
// measured with -j. The document must parse, agree with the text report figure for figure, and
// record the memory the two processes share.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <regex>
#include <string>

#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"

namespace fs = std::filesystem;

// Prints "PID MEMSPREAD" per process object in pid order, then "shared PID PID..." per shared
// record, its pids in order.
static const char* kSummarizeDocument = R"(import json, sys
document = json.load(open(sys.argv[1], encoding="utf-8"))
for process in sorted(document["processes"], key=lambda p: p["pid"]): print(process["pid"], process.get("memspread"))
for record in document["shared"]: print("shared", *sorted(record["pids"]))
)";

TEST(RKJsonEndToEnd, DocumentAgreesWithTheTextReportAndHoldsTheSharedGroup) {
    const fs::path document = fs::temp_directory_path() / ("rkjson-e2e-" + std::to_string(getpid()) + ".json");
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FIXTURE)) << fixture.error();
    const pid_t parent = fixture.pid(), child = fixture.childPid();
    RKCommandResult run = RKRunCommand(
        {MEMSPREAD_BINARY, "-f", "bytes", "-j", document.string(), std::to_string(parent), std::to_string(child)});
    fixture.stop();
    RKCommandResult parsed = RKRunCommand({"python3", "-c", kSummarizeDocument, document.string()});
    fs::remove(document);
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    ASSERT_TRUE(parsed.exitedWith(0)) << "the document does not parse: " << parsed.standardError;

    // The text report's header names the pid ("name [PID]: 64-bit"); the memspread line follows
    // it, or follows its warning lines.
    static const std::regex header(R"(\[(\d+)\]: (32|64)-bit)"), total(R"(\tMemspread: (-?\d+) B \()");
    std::map<pid_t, std::string> textFigures;
    pid_t current = -1;
    for (const std::string& line : RKSplitLines(run.standardOutput)) {
        std::smatch match;
        if (std::regex_search(line, match, header)) current = std::stoi(match[1]);
        if (std::regex_search(line, match, total)) textFigures[current] = match[1];
    }
    ASSERT_EQ(textFigures.size(), 2u) << run.standardOutput;
    EXPECT_NE(textFigures[parent], "0") << "the fixture wrote private memory of its own";
    std::string expected;
    for (const auto& [pid, figure] : textFigures) expected += std::to_string(pid) + " " + figure + "\n";
    const auto [low, high] = std::minmax(parent, child);
    expected += "shared " + std::to_string(low) + " " + std::to_string(high) + "\n";
    EXPECT_TRUE(parsed.standardOutput.starts_with(expected)) << parsed.standardOutput << "\nexpected:\n" << expected;
}
