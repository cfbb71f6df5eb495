// A process that all-process selection could not open, through a whole report: named with its
// pid and reason among the warnings of the text report and of the JSON document, never as a
// measured process, and escaped; one that is simply gone is not named at all.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>

#include "analysis/RKMemspread.h"
#include "output/RKOutputFormatterJSON.h"
#include "output/RKOutputFormatterText.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "support/RKRunCommand.h"

TEST(RKUnreadReport, ProcessThatCouldNotBeOpenedIsAWarningOfTheRun) {
    auto platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope(platform);
    RKScriptedRegion region;
    region.start = 0x10000, region.size = 4 * 4096;
    region.info = {.pages_resident = 4, .pages_dirtied = 4, .share_mode = SM_PRIVATE,
                   .object_id_full = 0x4000000000010000ull};
    platform->addProcess(7, "tool").regions = {region};
    platform->addProcess(8, "guard\x1b]0;").taskResult = KERN_PROTECTION_FAILURE;
    platform->addProcess(9, "starved").taskResult = KERN_RESOURCE_SHORTAGE;
    platform->addProcess(10, "exited").taskResult = KERN_INVALID_ARGUMENT;

    testing::internal::CaptureStderr();
    auto targets = RKProcess::allProcessesExcludingPids({});
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "task_for_pid: permission denied\ntask_for_pid: too many open files\ntask_for_pid: process is gone\n");
    ASSERT_TRUE(targets);
    EXPECT_EQ(targets->count(10), 0u) << "a process that is gone is no longer part of the system";
    RKProcessList processes;
    for (const auto& entry : *targets) processes.push_back(entry.second);
    const std::string textPath = testing::TempDir() + "rkunread-" + std::to_string(getpid()) + ".txt";
    const std::string jsonPath = textPath + ".json";
    FILE* file = std::fopen(textPath.c_str(), "w");
    ASSERT_TRUE(file);
    {
        RKMemspread memspread(processes);
        memspread.gatherData();
        memspread.analyzeData();
        memspread.addOutputFormatter(
            std::make_shared<RKOutputFormatterText>(RKSummaryFormatBytes, 0, "Dirty", file));
        auto json = RKOutputFormatterJSON::initWithPath(jsonPath);
        ASSERT_TRUE(json);
        memspread.addOutputFormatter(json);
        memspread.printOutputVerbose(false, false);
        json->close();
    }
    std::fclose(file);
    const std::string text = RKFileText(textPath), document = RKFileText(jsonPath);
    std::remove(textPath.c_str());
    std::remove(jsonPath.c_str());
    RKAnalysisSettings::resetCache();

    EXPECT_NE(text.find("Warnings were encountered while examining the following processes:\n"
                              "\tguard\\x1b]0; [8]: not measured - permission denied\n"
                              "\tstarved [9]: not measured - too many open files\n"),
              std::string::npos)
        << text;
    EXPECT_NE(text.find("tool [7]: 64-bit"), std::string::npos);
    EXPECT_EQ(text.find("guard\\x1b]0; [8]: 64-bit"), std::string::npos) << "not shown as measured";
    EXPECT_EQ(text.find("exited"), std::string::npos) << "gone: not named";
    EXPECT_NE(document.find(R"("warnings":["guard\u001b]0; [8]: not measured - permission denied",)"
                                  R"("starved [9]: not measured - too many open files"])"),
              std::string::npos)
        << document;
    EXPECT_EQ(document.find(R"("pid":8)"), std::string::npos) << "no process object of its own";
}
