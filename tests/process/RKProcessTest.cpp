// The process base, its factories and the two sources' construction, on scripted kernel answers.
#include "process/RKProcess.h"

#include <gtest/gtest.h>

#include <cstring>

#include "model/RKAuxData.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKKernelProcess.h"
#include "process/RKUserProcess.h"

namespace {

class RKProcessTest : public ::testing::Test {
protected:
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
};

std::shared_ptr<RKUserProcess> userProcess(pid_t pid) {
    return std::dynamic_pointer_cast<RKUserProcess>(RKProcess::processWithPid(pid));
}

}  // namespace

TEST_F(RKProcessTest, NameRuleFallsBackFromPathToRecordNames) {
    RKBsdInfo info;
    info.pbi_pid = 40;
    EXPECT_EQ(RKProcess::_nameForBsdInfo(info), "Unknown");
    std::strcpy(info.pbi_comm, "comm");
    EXPECT_EQ(RKProcess::_nameForBsdInfo(info), "comm");
    std::strcpy(info.pbi_name, "longer name");
    EXPECT_EQ(RKProcess::_nameForBsdInfo(info), "longer name") << "pbi_name comes before pbi_comm";
    auto& scripted = platform->addProcess(40, "comm");
    scripted.executablePath = "/usr/bin/foo";  // started as "foo bar": arguments play no part
    EXPECT_EQ(RKProcess::_nameForBsdInfo(info), "foo");
}

TEST_F(RKProcessTest, FactoriesChooseTheSourceFromTheRecord) {
    platform->addProcess(0, "kernel", 0, PROC_FLAG_SYSTEM).taskResult = KERN_PROTECTION_FAILURE;
    platform->addProcess(7, "tool").executablePath = "/opt/bin/tool";
    platform->addProcess(8, "guarded").taskResult = KERN_PROTECTION_FAILURE;
    platform->pageSize = 16384;

    auto kernel = RKProcess::processWithPid(0);
    ASSERT_TRUE(std::dynamic_pointer_cast<RKKernelProcess>(kernel)) << "the kernel needs no task";
    EXPECT_EQ(kernel->idleExitStatus(), 1);
    kernel->gatherData();
    kernel->gatherData();
    ASSERT_TRUE(kernel->memoryRegions());
    EXPECT_EQ(kernel->warnings().size(), 1u) << "gathered once";
    EXPECT_TRUE(kernel->auxData()->objectForKey("Maps"));

    auto tool = userProcess(7);
    ASSERT_TRUE(tool);
    EXPECT_EQ(tool->displayString(), "tool [7]");
    EXPECT_TRUE(tool->is64bit());
    EXPECT_EQ(tool->pageSize(), 16384u);

    testing::internal::CaptureStderr();
    EXPECT_FALSE(RKProcess::processWithPid(8));
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "task_for_pid: permission denied\n");
    EXPECT_FALSE(RKProcess::processWithPid(9)) << "no record";
    RKProcess base;
    EXPECT_FALSE(base.initWithBsdInfo(platform->find(7)->info)) << "the base reads nothing";
}

TEST_F(RKProcessTest, UserProcessFiguresAndSharedRegion) {
    auto& tracked = platform->addProcess(10, "clean");
    tracked.dirtyFlags = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    tracked.rusage = {1 << 20, 3 << 20};
    platform->addProcess(11, "dirty").dirtyFlags = 0x7;
    platform->addProcess(12, "untracked").dirtyFlags = PROC_DIRTY_TRACKED;
    platform->addProcess(13, "arm32", 1, 0).rusageErrno = EPERM;

    auto clean = userProcess(10);
    EXPECT_EQ(clean->idleExitStatus(), 2);
    EXPECT_EQ(userProcess(11)->idleExitStatus(), 3);
    EXPECT_EQ(userProcess(12)->idleExitStatus(), 1);
    EXPECT_EQ(clean->phys_memspread_peak(), 3u << 20);
    EXPECT_EQ(userProcess(13)->phys_memspread(), 0u) << "a failed usage read leaves the figures alone";
    ASSERT_TRUE(clean->images());
    // Without a shared library cache (Linux) the bounds stay 0; with one they follow the
    // architecture.
    EXPECT_EQ(clean->sharedRegionBase() + clean->sharedRegionSize(), 0u);
    platform->sharedRegion = true;
    EXPECT_EQ(userProcess(10)->sharedRegionBase(), 0x180000000u);
    auto arm = userProcess(13);
    EXPECT_EQ(arm->sharedRegionSize(), 0x40000000u);

    testing::internal::CaptureStderr();
    EXPECT_FALSE(arm->_setSharedRegionFromPlatform(RKPlatformUnknown));
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "Unable to determine platform architecture of target\n");
    EXPECT_TRUE(arm->_setSharedRegionFromPlatform(RKPlatformLinux));
    EXPECT_EQ(arm->sharedRegionBase(), 0x40000000u) << "neither changes the bounds";
}
