// A live process's task on scripted kernel answers: it is open only while the process is read,
// and a pid reused between listing and reading never lends the new process's name or memory to
// the listed one.
#include <gtest/gtest.h>

#include <cstring>

#include "driver/RKMemspreadArgs.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint64_t P = 4096;

RKScriptedRegion region(uint64_t start, uint64_t pages, uint32_t dirtied) {
    RKScriptedRegion entry;
    entry.start = start;
    entry.size = pages * P;
    entry.info = {.pages_resident = dirtied, .pages_dirtied = dirtied, .share_mode = SM_PRIVATE,
                  .object_id_full = 0x4000000000000000ull | start};
    return entry;
}

class RKTaskLifecycleTest : public ::testing::Test {
protected:
    RKTaskLifecycleTest() {
        platform->addProcess(0, "kernel", 0, PROC_FLAG_SYSTEM);
        RKScriptedProcess& listed = platform->addProcess(40, "listed");
        listed.info.pbi_start_tvsec = 1000;
        listed.executablePath = "/usr/bin/listed";
        listed.regions = {region(0x10000, 4, 4)};
    }
    void TearDown() override { RKAnalysisSettings::resetCache(); }

    RKScriptedProcess& listed() { return *platform->find(40); }
    // The pid 40 now names a process that started later, with memory of its own.
    void reuse() {
        RKBsdInfo intruder = listed().info;
        std::strncpy(intruder.pbi_comm, "intruder", MAXCOMLEN);
        intruder.pbi_start_tvsec = 2000;
        listed().reusedBy = intruder;
        listed().reusedByExecutablePath = "/usr/bin/intruder";
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
};

}  // namespace

TEST_F(RKTaskLifecycleTest, TaskIsOpenOnlyWhileTheProcessIsRead) {
    auto process = std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(40));
    ASSERT_TRUE(process);
    EXPECT_EQ(process->name(), "listed") << "named through the task";
    EXPECT_EQ(process->task(), nullptr) << "closed once initialised";
    EXPECT_EQ(platform->callCount("taskForPid"), 1u);
    process->gatherData();
    EXPECT_EQ(process->task(), nullptr) << "closed once gathered";
    EXPECT_EQ(platform->callCount("taskForPid"), 2u) << "opened again for gathering";
    ASSERT_TRUE(process->memoryRegions());
    EXPECT_EQ(process->memoryRegions()->size(), 1u);
}

TEST_F(RKTaskLifecycleTest, ReusedPidNeverReadAsTheListedProcess) {
    // Reused between listing and opening: the listed process is gone, nothing is made of it.
    reuse();
    testing::internal::CaptureStderr();
    auto targets = RKProcess::allProcessesExcludingPids({});
    const std::string printed = testing::internal::GetCapturedStderr();
    ASSERT_TRUE(targets);
    EXPECT_EQ(targets->count(40), 0u);
    EXPECT_EQ(platform->callCount("taskExecutablePath"), 0u) << "the intruder's name is never read";
    EXPECT_NE(printed.find("task_for_pid: process is gone"), std::string::npos) << printed;

    // Reused between opening and gathering: a warning of the listed process, and no memory.
    listed().reusedBy.reset();
    auto process = RKProcess::processWithPid(40);
    ASSERT_TRUE(process);
    reuse();
    testing::internal::CaptureStderr();
    process->gatherData();
    testing::internal::GetCapturedStderr();
    EXPECT_EQ(process->name(), "listed");
    EXPECT_FALSE(process->memoryRegions()) << "the intruder's regions are not the listed process's";
    EXPECT_EQ(platform->callCount("regionRecurse"), 0u);
    EXPECT_EQ(process->warnings(), std::vector<std::string>{"listed [40]: process is gone (process exited)"});
    EXPECT_TRUE(process->errors().empty());
}
