// What the formatters receive for one report, and in which order.
#include <gtest/gtest.h>

#include "RKAnalysisTestSupport.h"

// 10: private and shared memory, a global error; 20: an error and a warning; 30: hidden. The
// formatter loop is the innermost; F2 implements none of the optional calls.
TEST(RKReportDrivingTest, OneReportOnTwoFormattersInTheFixedOrder) {
    ScopedSettings settings(true);
    auto healthy = makeProcess(10, {region(1, 0, 8192, 8192), region(3, 0, 4096, 0)});
    healthy->auxMemspread = 100;
    healthy->_addGlobalError("lost a process");
    auto failing = makeProcess(20, {region(3, 0, 4096, 0)});
    failing->addError("cannot read");
    failing->addWarning("exited");
    failing->auxMemspread = 7;
    auto journal = std::make_shared<RKRecordingFormatter::Journal>();
    auto first = std::make_shared<RKRecordingFormatter>("F1", true, journal);
    auto second = std::make_shared<RKRecordingFormatter>("F2", false, journal);
    report({healthy, failing, makeProcess(30, {region(9, 0, 4096, 4096)}, true)}, {first, second}, true);
    EXPECT_EQ(first->journalText(), RKExpectedJournal("analysis-report-calls.txt"));
}

TEST(RKReportDrivingTest, AGlobalErrorAloneMeansTheReportHadErrors) {
    ScopedSettings settings(true);
    auto process = makeProcess(10, {region(1, 0, 4096, 4096)});
    process->_addGlobalError("gathering cut short");
    auto recorder = std::make_shared<RKRecordingFormatter>();
    report({process}, {recorder});
    EXPECT_EQ(recorder->callsNamed("printSummaryCategories")[0].arguments, " dirty=4096 regions=1 [shared] hadErrors");
}

// A report releases its memory objects as it ends (sampling writes one report after another),
// unless it is to leave them, with its processes and groups, to whoever takes its remains.
TEST(RKReportDrivingTest, ObjectsOutliveTheReportOnlyInItsRemains) {
    ScopedSettings settings(false);
    for (bool keep : {false, true}) {
        auto process = makeProcess(10, {region(1, 0, 4096, 4096)});
        const RKMemoryRegion& mapping = *process->memoryRegions()->front();
        RKMemspread memspread({process});
        memspread.setKeepsReportRemains(keep);
        memspread.analyzeData();
        memspread.printOutputVerbose(false, false);
        EXPECT_EQ(mapping.memoryObject() != nullptr, keep);
        RKMemspread::ReportRemains remains = memspread.takeReportRemains();
        EXPECT_EQ(remains.groups.size(), keep ? 1u : 0u);
        remains = {};
        EXPECT_EQ(mapping.memoryObject(), nullptr);
    }
}
