// Anonymous pages shared across fork or by KSM, on scripted frames: each page lands in the
// group of exactly the measured processes that hold it, counted once, and leaves the regions it
// came from; a page one measured process holds alone stays its own.
#include <gtest/gtest.h>

#include <algorithm>
#include <set>

#include "analysis/RKAnalysisTypes.h"
#include "analysis/RKMemspread.h"
#include "model/RKMemoryObject.h"
#include "model/RKProcessGroup.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

constexpr uint64_t P = 4096;
constexpr uint64_t kStart = 0x10000;

class RKSharedAnonymousPassTest : public ::testing::Test {
protected:
    RKSharedAnonymousPassTest() {
        platform->selfRegionValue = 1;  // the breakdown on, as the program runs by default
        platform->pageAbilities.frames = true;
        RKAnalysisSettings::resetCache();
    }
    ~RKSharedAnonymousPassTest() override { RKAnalysisSettings::resetCache(); }

    // A process with one private anonymous region of 8 pages that smaps says shares pages:
    // `frames` by page index (RKSwappedPageKey marks a swapped one).
    void addProcess(pid_t pid, std::map<uint64_t, uint64_t> frames, uint32_t swapped = 0) {
        RKScriptedProcess& process = platform->addProcess(pid, "worker");
        RKScriptedRegion region;
        region.start = kStart;
        region.size = 8 * P;
        region.info.share_mode = SM_COW;
        region.info.pages_resident = 8 - swapped;
        region.info.pages_dirtied = 8 - swapped;
        region.info.pages_swapped_out = swapped;
        region.info.object_id_full = 0x4000000000000000ull | static_cast<uint64_t>(pid) << 32;
        process.regions = {region};
        for (const auto& [index, frame] : frames) process.sharedAnonymous[kStart + index * P] = frame;
    }

    // Analyzed processes and the distinct memory objects of their groups.
    RKProcessToGroupsMap analyze(RKMemspread& memspread) {
        for (const auto& process : memspread.processes()) process->gatherData();
        memspread.analyzeData();
        return memspread._generateProcessToProcessGroups();
    }

    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
};

TEST_F(RKSharedAnonymousPassTest, EachPageInTheGroupOfExactlyItsHolders) {
    const uint64_t swap5 = RKSwappedPageKey | 5;
    addProcess(10, {{0, 100}, {1, 101}, {2, 200}, {3, 300}});  // 300: held by no other measured process
    addProcess(11, {{0, 100}, {1, 101}, {2, 200}, {7, swap5}}, 1);
    addProcess(12, {{4, 100}, {5, 101}, {6, swap5}, {7, 100}}, 1);  // at other addresses, 100 twice
    RKMemspread memspread({RKProcess::processWithPid(10), RKProcess::processWithPid(11), RKProcess::processWithPid(12)});
    RKProcessToGroupsMap groups = analyze(memspread);

    std::map<std::set<pid_t>, std::pair<uint64_t, uint64_t>> bySet;  // dirty, swapped
    std::set<const RKProcessGroup*> seen;
    for (const auto& [pid, list] : groups) {
        for (const auto& group : list) {
            if (!seen.insert(group.get()).second) continue;
            std::set<pid_t> members;
            for (const auto& member : group->processes()) members.insert(member->pid());
            for (const auto& object : group->objects()) {
                bySet[members].first += object->totalDirtySize();
                bySet[members].second += object->totalSwappedSize();
            }
        }
    }
    const std::map<std::set<pid_t>, std::pair<uint64_t, uint64_t>> expected = {
        {{10}, {5 * P, 0}},             // 8 pages, 3 of them shared
        {{11}, {4 * P, 0}},             // 7 present, 3 shared; the swapped one shared
        {{12}, {4 * P, 0}},             // frame 100 leaves both its pages, counted once below
        {{10, 11, 12}, {2 * P, 0}},     // frames 100 and 101, once
        {{10, 11}, {P, 0}},
        {{11, 12}, {0, P}},
    };
    EXPECT_EQ(bySet, expected);
    // Each process is still charged everything it maps, a frame mapped twice once.
    for (auto [pid, pages] : {std::pair{10, 8}, {11, 8}, {12, 7}})
        EXPECT_EQ(memspread.pidToMemspread().at(pid), pages * P) << pid;
    // Nothing per page is kept after the pass.
    for (const auto& process : memspread.processes())
        EXPECT_TRUE(std::dynamic_pointer_cast<RKUserProcess>(process)->sharedAnonymousPages().capacity() == 0u);
}

// Frames hidden (no root), or the pass turned off: the regions keep their pages, and one line
// gives the bound of what may count more than once. Turned off, not a frame is read.
TEST_F(RKSharedAnonymousPassTest, HiddenFramesOrThePassOffLeaveTheNumbersAndWarnOnce) {
    for (bool off : {false, true}) {
        SCOPED_TRACE(off ? "off" : "hidden");
        platform = std::make_shared<RKScriptedPlatform>();
        RKScopedPlatform fresh{platform};
        platform->selfRegionValue = 1;
        RKAnalysisSettings::resetCache();
        platform->pageAbilities.frames = off;
        RKAnalysisSettings::setForkSharingDisabled(off);
        addProcess(10, {{0, 100}});
        addProcess(11, {{0, 100}});
        for (pid_t pid : {10, 11}) {
            if (!off) platform->find(pid)->sharedAnonymousResult = KERN_NOT_SUPPORTED;
            platform->find(pid)->sharedAnonymousBytes = 6 * P;
        }
        RKMemspread memspread({RKProcess::processWithPid(10), RKProcess::processWithPid(11)});
        testing::internal::CaptureStderr();
        analyze(memspread);
        RKAnalysisSettings::setForkSharingDisabled(false);
        EXPECT_EQ(testing::internal::GetCapturedStderr(),
                  std::string("memspread: 49152 bytes of anonymous memory are shared between processes (after fork or "
                              "by KSM) and ") +
                      (off ? "are not attributed (MEMSPREAD_FORK_SHARING=off)" : "cannot be attributed without root") +
                      "; the summary may count them more than once\n");
        for (pid_t pid : {10, 11}) EXPECT_EQ(memspread.pidToMemspread().at(pid), 8 * P);
        const std::vector<std::string> calls = platform->calls();
        EXPECT_EQ(std::count(calls.begin(), calls.end(), "sharedAnonymousPages 10"), off ? 0 : 1);
    }
}

}  // namespace
