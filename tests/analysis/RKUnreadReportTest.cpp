// A process that all-process selection could not open, through a whole report: a warning of the
// run with its pid and reason, never a measured process; one that is simply gone is not named at
// all. (How the text and JSON reports escape a warning, their golden files show.)
#include <gtest/gtest.h>

#include "RKAnalysisTestSupport.h"

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
    auto recorder = std::make_shared<RKRecordingFormatter>("F", false);
    {
        RKMemspread memspread(processes);
        memspread.gatherData();
        memspread.analyzeData();
        memspread.addOutputFormatter(recorder);
        memspread.printOutputVerbose(false, false);
    }
    RKAnalysisSettings::resetCache();
    const auto headers = recorder->callsNamed("printProcessHeader");
    ASSERT_EQ(headers.size(), 1u) << recorder->journalText();
    EXPECT_EQ(headers[0].pid, 7);
    EXPECT_EQ(recorder->callsNamed("printProcessesWithWarnings")[0].arguments, " warnings=8,9 errors=-");
    EXPECT_EQ(processes.at(1)->warnings(), std::vector<std::string>{"guard\x1b]0; [8]: not measured - permission denied"});
    EXPECT_EQ(processes.at(2)->warnings(), std::vector<std::string>{"starved [9]: not measured - too many open files"});
}
