// The fixture of the process tests: scripted kernel answers for the kernel [0], init [1] and a
// process "tool" [7], with memspread itself at pid 600. A process is made as the program makes
// it, and what making it printed is kept.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <type_traits>

#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

class RKScriptedToolTest : public ::testing::Test {
protected:
    RKScriptedToolTest() {
        platform->addProcess(0, "kernel", 0, PROC_FLAG_SYSTEM);
        platform->addProcess(1, "init", 0);
        platform->addProcess(7, "tool");
        platform->selfPid = 600;
    }
    ~RKScriptedToolTest() override { RKAnalysisSettings::resetCache(); }

    RKScriptedProcess& tool() { return *platform->find(7); }
    // The process of `pid`, with or without the breakdown, gathered; or, not gathered, with its
    // task open as gathering holds it, for the steps of gathering called one by one.
    template <class Process = RKUserProcess>
    std::shared_ptr<Process> made(pid_t pid, bool breakDown, bool gather = true) {
        platform->selfRegionValue = breakDown ? 1 : 0;
        RKAnalysisSettings::resetCache();
        testing::internal::CaptureStderr();
        auto process = std::dynamic_pointer_cast<Process>(RKProcess::processWithPid(pid));
        if (process && gather) process->gatherData();
        if constexpr (std::is_same_v<Process, RKUserProcess>)
            if (process && !gather) process->_reopenTaskForGathering();
        printed = testing::internal::GetCapturedStderr();
        return process;
    }
    std::shared_ptr<RKUserProcess> gathered(bool breakDown = false) { return made(7, breakDown); }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::string printed;
};
