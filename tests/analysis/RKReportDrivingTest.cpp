// What the formatters receive for one report, and in which order.
#include <gtest/gtest.h>

#include <set>

#include "RKAnalysisTestSupport.h"
#include "model/RKMemoryObject.h"

namespace {

std::shared_ptr<RKAuxDataMap> auxWith(int64_t value) {
    auto aux = std::make_shared<RKAuxDataMap>();
    aux->setObject("memspread", std::make_shared<RKAuxData>(value, true));
    return aux;
}

// 10: private and shared memory, a global error; 20: an error and a warning; 30: hidden.
RKProcessList troubledSystem() {
    auto healthy = makeProcess(10, {region(1, 0, 8192, 8192, "own"), region(3, 0, 4096, 0)});
    healthy->aux = auxWith(100);
    healthy->_addGlobalError("lost a process");
    auto failing = makeProcess(20, {region(3, 0, 4096, 0)});
    failing->addError("cannot read");
    failing->addWarning("exited");
    failing->aux = auxWith(7);
    return processList(healthy, failing, makeProcess(30, {region(9, 0, 4096, 4096)}, true));
}

}  // namespace

TEST(RKReportDrivingTest, OneReportOnTwoFormattersInTheFixedOrder) {
    ScopedSettings settings(true);
    auto journal = std::make_shared<RKRecordingFormatter::Journal>();
    auto first = std::make_shared<RKRecordingFormatter>("F1", RKRecordingCapabilities{}, journal);
    auto second = std::make_shared<RKRecordingFormatter>(
        "F2", RKRecordingCapabilities{.startAtTime = false, .spanlistLikeOutput = false}, journal);
    report(troubledSystem(), {first, second}, true);

    const std::vector<std::string> expected{
        "F1 startAtTime", "F1 printSpanlistLikeOutputForProcess 10", "F1 printSpanlistLikeOutputForProcess 20",
        "F1 printProcessHeader 10", "F1 printProcessTotal 10", "F1 endProcessHeader 10",
        "F2 printProcessHeader 10", "F2 printProcessTotal 10", "F2 endProcessHeader 10",
        "F1 printProcessCategories", "F2 printProcessCategories",
        "F1 printSharedCategories 10", "F2 printSharedCategories 10",
        "F1 printProcessAuxData", "F2 printProcessAuxData",
        "F1 printProcessHeader 20", "F1 endProcessHeader 20", "F2 printProcessHeader 20", "F2 endProcessHeader 20",
        "F1 printProcessCategories", "F2 printProcessCategories",
        "F1 printProcessAuxData", "F2 printProcessAuxData",
        "F1 printProcessesWithWarnings", "F2 printProcessesWithWarnings",
        "F1 printSummaryCategories", "F1 printGlobalAuxData", "F1 endAtTime",
        "F2 printSummaryCategories", "F2 printGlobalAuxData", "F2 endAtTime"};
    EXPECT_EQ(first->lines(), expected);

    auto tables = second->callsNamed("printProcessCategories");
    ASSERT_EQ(tables.size(), 2u);
    EXPECT_EQ(tables[0].total.dirty, 8192u);
    EXPECT_TRUE(tables[1].categories.empty());  // the process with errors
    EXPECT_EQ(tables[1].total, RKMemoryTotal{});
    auto aux = second->callsNamed("printProcessAuxData");
    ASSERT_TRUE(aux[1].auxData);
    EXPECT_EQ(std::static_pointer_cast<const RKAuxData>(aux[1].auxData->objectForKey("memspread"))->value(), 7);

    auto lists = second->callsNamed("printProcessesWithWarnings")[0];
    EXPECT_EQ(lists.warningPids, std::vector<pid_t>{20});
    EXPECT_EQ(lists.errorPids, std::vector<pid_t>{20});
    EXPECT_EQ(lists.globalErrors, std::vector<std::string>{"lost a process"});
    EXPECT_TRUE(second->callsNamed("printSummaryCategories")[0].hadErrors);
    // Only processes without errors add to the report-wide aux data.
    auto global = second->callsNamed("printGlobalAuxData")[0].auxData;
    ASSERT_TRUE(global);
    EXPECT_EQ(std::static_pointer_cast<const RKAuxData>(global->objectForKey("memspread"))->value(), 100);

    auto quiet = std::make_shared<RKRecordingFormatter>();
    report(troubledSystem(), {quiet}, false);
    EXPECT_TRUE(quiet->callsNamed("printSpanlistLikeOutputForProcess").empty());
}

TEST(RKReportDrivingTest, HadErrorsFollowsAGlobalErrorAlone) {
    ScopedSettings settings(true);
    for (bool globalError : {false, true}) {
        auto process = makeProcess(10, {region(1, 0, 4096, 4096)});
        if (globalError) process->_addGlobalError("gathering cut short");
        auto recorder = std::make_shared<RKRecordingFormatter>();
        report(processList(process), {recorder});
        EXPECT_TRUE(recorder->callsNamed("printProcessesWithWarnings")[0].errorPids.empty());
        EXPECT_EQ(recorder->callsNamed("printSummaryCategories")[0].hadErrors, globalError);
    }
}

// A group of 26 or more whose objects look alike to every member computes its categories once;
// one whose owner sees the memory differently from the others never shares them.
TEST(RKReportDrivingTest, LargeGroupsShareOneCategoryComputation) {
    struct Case {
        size_t members;
        bool owned;
        size_t computations;
    };
    for (Case c : {Case{25, false, 25}, Case{26, false, 1}, Case{26, true, 26}}) {
        SCOPED_TRACE(testing::Message() << c.members << (c.owned ? " owned" : ""));
        ScopedSettings settings(true);
        RKProcessList processes;
        for (size_t i = 0; i < c.members; i++) {
            auto mapping = region(1, 0, 8192, 8192);
            // The owner has the highest pid, so it is printed first.
            mapping->ownedExclusivelyByParentProcess = c.owned && i + 1 == c.members;
            processes.push_back(makeProcess(static_cast<pid_t>(100 + i), {mapping}));
        }
        auto recorder = std::make_shared<RKRecordingFormatter>();
        report(processes, {recorder});

        auto shared = recorder->callsNamed("printSharedCategories");
        ASSERT_EQ(shared.size(), c.members);
        EXPECT_EQ(shared[0].pid, static_cast<pid_t>(100 + c.members - 1));
        std::set<const void*> computations;
        size_t chargedDirty = 0;
        for (const auto& call : shared) {
            computations.insert(call.categoriesIdentity());
            EXPECT_EQ(call.hasProcessView, c.owned && call.pid != shared[0].pid);
            chargedDirty += call.total.dirty;
        }
        EXPECT_EQ(computations.size(), c.computations);
        EXPECT_EQ(chargedDirty, c.owned ? 8192u : 8192u * c.members);
    }
}

TEST(RKReportDrivingTest, IdentityMapsAreReleasedBeforeTheFirstProcessIsPrinted) {
    ScopedSettings settings(true);
    auto shown = makeProcess(10, {region(1, 0, 4096, 4096)});
    auto hidden = makeProcess(5, {region(8, 0, 4096, 4096)}, true);
    RKMemspread memspread(processList(shown, hidden));
    memspread.analyzeData();
    std::weak_ptr<RKMemoryObject> hiddenOnly = (*hidden->memoryRegions())[0]->memoryObject();
    ASSERT_FALSE(hiddenOnly.expired());

    auto recorder = std::make_shared<RKRecordingFormatter>();
    std::vector<bool> expiredAtHeader;
    recorder->onCall = [&](const RKRecordedCall& call) {
        if (call.name == "printProcessHeader") expiredAtHeader.push_back(hiddenOnly.expired());
    };
    memspread.addOutputFormatter(recorder);
    memspread.printOutputVerbose(false, false);
    EXPECT_EQ(expiredAtHeader, std::vector<bool>{true});
    EXPECT_EQ(memspread.identityMaps(), nullptr);
}
