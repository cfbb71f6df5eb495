// The system map on scripted answers: which figure goes to which term, memory shared between
// processes counted once, the processes' page tables taken out of the kernel's, and processes
// that could not be read left to "unattributed". And a process that all-process selection could
// not open, through a whole report: a warning of the run with its pid and reason, never a
// measured process; one that is simply gone is not named at all. (How the text and JSON reports
// escape a warning, their golden files show.)
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <set>

#include "analysis/RKSystemMemory.h"
#include "platform/RKLinuxKernelKinds.h"
#include "process/RKKernelProcess.h"
#include "process/RKUserProcess.h"
#include "analysis/RKAnalysisTestSupport.h"
#include "support/RKRecordingFormatter.h"

namespace {

constexpr uint64_t P = 4096;

RKMemoryInfoRecord counterRecord(std::string_view name, uint64_t value) {
    RKMemoryInfoRecord record;
    record.flags = VM_KERN_SITE_COUNTER, record.mapped = value;
    record.site = uint64_t(std::find(RKLinuxKernelCounters.begin(), RKLinuxKernelCounters.end(), name) -
                           RKLinuxKernelCounters.begin());
    return record;
}

RKMemoryInfoRecord tagRecord(uint64_t tag, uint64_t size) {
    RKMemoryInfoRecord record;
    record.flags = VM_KERN_SITE_TAG | VM_KERN_SITE_WIRED, record.site = tag, record.size = size;
    return record;
}

int64_t leaf(const RKAuxDataMap& map, const std::string& key) {
    auto node = std::dynamic_pointer_cast<const RKAuxData>(map.objectForKey(key));
    EXPECT_TRUE(node) << key;
    return node ? node->value() : 0;
}

class RKSystemMemoryTest : public ::testing::Test {
protected:
    RKSystemMemoryTest() {
        platform->addProcess(0, "kernel", 0, PROC_FLAG_SYSTEM);
        RKScriptedProcess& tool = platform->addProcess(7, "tool");
        RKScriptedRegion anonymous;
        anonymous.start = 0x10000, anonymous.size = 2 * P;
        anonymous.info = {.pages_resident = 2, .pages_dirtied = 2, .share_mode = SM_PRIVATE,
                          .object_id_full = 0x4000000000010000ull};
        tool.regions = {anonymous};
        tool.ledgerBalances = {static_cast<int64_t>(P)};
        platform->selfRegionValue = 1;  // the breakdown: processes are charged their page tables

        RKKernelMemoryInfo& kernel = platform->kernelMemory;
        kernel.zoneNames = {RKZoneName{}};
        std::strcpy(kernel.zoneNames[0].mzn_name, "dentry");
        kernel.zones = {RKZoneInfo{.mzi_cur_size = 10000, .mzi_collectable = 1}};
        kernel.sites = {tagRecord(RKKernelTagPageTables, 2 * P), tagRecord(RKKernelTagUserWired, P)};
        const std::pair<const char*, uint64_t> counters[] = {
            {"MemTotal", 1000000}, {"MemFree", 500000},       {"Buffers", 1000},          {"Cached", 50000},
            {"Mapped", 20000},     {"PageTables", 2 * P},     {"Hugetlb", 40000},         {"HugePages_Total", 40000},
            {"HugePages_Free", 10000}, {"Zswap", 3000}};
        for (const auto& [counter, value] : counters) kernel.sites.push_back(counterRecord(counter, value));
    }
    void TearDown() override { RKAnalysisSettings::resetCache(); }

    RKProcessList gathered() {
        RKAnalysisSettings::resetCache();
        RKProcessList list{RKProcess::processWithPid(0), RKProcess::processWithPid(7)};
        for (const auto& process : list) process->gatherData();
        // Two processes that share one object, and one that could not be read.
        list.push_back(makeProcess(10, {region(0x8000000000000001ull, 0, 4 * P, P)}));
        list.push_back(makeProcess(11, {region(0x8000000000000001ull, 0, 4 * P, P)}));
        auto unreadable = makeProcess(12, {region(0x8000000000000002ull, 0, 8 * P, 8 * P)});
        unreadable->addError("gone");
        list.push_back(unreadable);
        return list;
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
};

TEST_F(RKSystemMemoryTest, TermsAddUpToMemTotalWithEveryByteInOneTerm) {
    RKMemspread memspread(gathered());
    memspread.analyzeData();
    RKSystemMemory system = RKAccountForSystemMemory(memspread.processes(), true);
    ASSERT_TRUE(system.map);
    const RKAuxDataMap& map = *system.map;
    EXPECT_EQ(leaf(map, "free"), 500000);
    EXPECT_EQ(leaf(map, "processes"), int64_t(4 * P + 2 * P + P)) << "the shared object once, the tool and its page table";
    EXPECT_EQ(leaf(map, "kernel"), int64_t(10000 + 2 * P - P)) << "user-wired memory and the tool's page table left out";
    EXPECT_EQ(leaf(map, "page cache (not mapped)"), 1000 + 50000 - 20000);
    EXPECT_EQ(leaf(map, "huge pages (free)"), 10000);
    EXPECT_EQ(leaf(map, "compressed swap pool"), 3000);
    int64_t sum = 0;
    for (const auto& [key, node] : map.entries())
        if (key != "MemTotal") sum += std::static_pointer_cast<const RKAuxData>(node)->value();
    EXPECT_EQ(sum, 1000000);
    EXPECT_EQ(map.entries().rbegin()->first, "unattributed") << "the last term";
    EXPECT_EQ(system.unreadableProcesses, 1u);

    // Without the kernel's figures there is nothing to account with.
    RKProcessList users(memspread.processes().begin() + 1, memspread.processes().end());
    EXPECT_FALSE(RKAccountForSystemMemory(users, true).map);
}

// Only a run over every process accounts for the system, and says how many processes it could
// not read.
TEST_F(RKSystemMemoryTest, OnlyARunOverEveryProcessReportsTheUnreadableOnes) {
    for (bool whole : {false, true}) {
        auto recorder = std::make_shared<RKRecordingFormatter>();
        RKMemspread memspread(gathered());
        memspread.setMeasuresWholeSystem(whole);
        memspread.analyzeData();
        memspread.addOutputFormatter(recorder);
        memspread.printOutputVerbose(false, true);
        const std::string calls = recorder->journalText();
        EXPECT_EQ(calls.find(" [1 processes could not be read: their memory is in the system's \"unattributed\"]") !=
                      std::string::npos,
                  whole)
            << calls;
    }
}

TEST_F(RKSystemMemoryTest, ProcessThatCouldNotBeOpenedIsAWarningOfTheRun) {
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
    RKMemspread memspread(processes);
    memspread.gatherData();
    memspread.analyzeData();
    memspread.addOutputFormatter(recorder);
    memspread.printOutputVerbose(false, false);
    std::set<pid_t> headers;
    for (const auto& call : recorder->callsNamed("printProcessHeader")) headers.insert(call.pid);
    EXPECT_EQ(headers, (std::set<pid_t>{0, 7})) << recorder->journalText();
    EXPECT_EQ(recorder->callsNamed("printProcessesWithWarnings")[0].arguments, " warnings=8,9 errors=-");
    EXPECT_EQ(processes.at(2)->warnings(), std::vector<std::string>{"guard\x1b]0; [8]: not measured - permission denied"});
    EXPECT_EQ(processes.at(3)->warnings(), std::vector<std::string>{"starved [9]: not measured - too many open files"});
}

}  // namespace
