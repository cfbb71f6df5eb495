// Gathering orchestration: every process gathered once on niced workers between the stamps,
// a cancel before or during gathering and its early-exit error, and SIGINT delivered as an event.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "analysis/RKCancelSource.h"
#include "analysis/RKMemspread.h"
#include "platform/RKScriptedPlatform.h"

namespace {

int ownNiceness() { return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::gettid())); }

// A process whose gathering only records how often, how niced and between which stamps it ran;
// given a flag, it first waits (boundedly) for it, so a test can order it after another process.
struct RKRecordingProcess : RKProcess {
    int gathered = 0;
    int niceness = 0;
    size_t stampsBefore = 0;
    size_t gathersOpen = 0;
    const std::atomic<bool>* waitFor = nullptr;
    void gatherData() override {
        for (int waited = 0; waitFor && !waitFor->load() && waited < 10000; waited++)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        gathered++;
        niceness = ownNiceness();
        auto& platform = dynamic_cast<RKScriptedPlatform&>(RKPlatform::current());
        stampsBefore = platform.callCount("getTimes");
        gathersOpen = platform.callCount("beginGather") - platform.callCount("endGather");
    }
};

// Processes of `pids` under a scripted platform.
struct Gathering {
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    std::vector<std::shared_ptr<RKRecordingProcess>> processes;
    explicit Gathering(const std::vector<pid_t>& pids) {
        for (pid_t pid : pids) {
            processes.push_back(std::make_shared<RKRecordingProcess>());
            processes.back()->setPid(pid);
        }
    }
};

}  // namespace

TEST(RKGather, ACancelBeforeGatheringGathersNothingAndFlagsTheLowestPid) {
    Gathering g({300, 5, 4000});
    RKMemspread memspread({g.processes.begin(), g.processes.end()});
    memspread.cancel();
    EXPECT_TRUE(memspread.gatherData());
    for (const auto& process : g.processes) EXPECT_EQ(process->gathered, 0);
    EXPECT_TRUE(g.processes[0]->globalErrors().empty() && g.processes[2]->globalErrors().empty());
    EXPECT_EQ(g.processes[1]->globalErrors(),
              std::vector<std::string>{"Memspread exited early due to SIGINT and did not finish gathering all data"});
    // An empty list gathers nothing, is not cancelled, and is stamped all the same.
    RKMemspread none({});
    EXPECT_FALSE(none.gatherData());
    EXPECT_TRUE(none.gatherStartTime() && none.gatherEndTime());
}

// A cancel during gathering lets the processes already started finish and skips the rest.
// The others wait for the cancel, so another worker cannot run them all before it comes.
TEST(RKGather, ACancelDuringGatheringSkipsTheProcessesNotYetStarted) {
    std::vector<pid_t> pids;
    for (pid_t pid = 1; pid <= 200; pid++) pids.push_back(pid);
    Gathering g(pids);
    std::atomic<bool> cancelled{false};
    for (const auto& process : g.processes) process->waitFor = &cancelled;
    struct Canceller : RKRecordingProcess {
        RKMemspread* memspread = nullptr;
        std::atomic<bool>* done = nullptr;
        void gatherData() override {
            RKRecordingProcess::gatherData();
            memspread->cancel();
            done->store(true);
        }
    };
    auto canceller = std::make_shared<Canceller>();
    canceller->setPid(1000);  // the highest pid, so the first taken up
    RKProcessList all(g.processes.begin(), g.processes.end());
    all.push_back(canceller);
    RKMemspread memspread(all);
    canceller->memspread = &memspread;
    canceller->done = &cancelled;
    EXPECT_TRUE(memspread.gatherData());
    EXPECT_EQ(canceller->gathered, 1);
    int gathered = 0;
    for (const auto& process : g.processes) gathered += process->gathered;
    EXPECT_LT(gathered, 200) << "processes were still taken up after the cancel";
    EXPECT_FALSE(g.processes[0]->globalErrors().empty()) << "the lowest pid carries the early-exit error";
}

TEST(RKGather, EveryProcessIsGatheredOnceOnNicedWorkersBetweenTheStamps) {
    Gathering g({1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16});
    // Of utility quality of service unless told otherwise.
    RKMemspread memspread({g.processes.begin(), g.processes.end()});
    EXPECT_FALSE(memspread.gatherData());
    for (const auto& process : g.processes) {
        EXPECT_EQ(process->gathered, 1);
        EXPECT_EQ(process->stampsBefore, 1u) << "not gathered between the start and the end stamp";
        EXPECT_EQ(process->gathersOpen, 1u) << "not within the one gather the platform was told of";
        EXPECT_EQ(process->niceness, std::min(ownNiceness() + 5, 19)) << "not on a worker niced by 5";
    }
    EXPECT_EQ(g.platform->callCount("endGather"), 1u);
    // User-initiated gathering runs at the caller's own priority.
    RKMemspread sampling({g.processes[0]});
    sampling.setQualityOfService(QOS_CLASS_USER_INITIATED);
    sampling.gatherData();
    EXPECT_EQ(g.processes[0]->niceness, ownNiceness());
}

// SIGINT is ignored and comes to the handler as an event, once per signal, until the source
// goes; then SIGINT has its default action back and is no longer blocked.
TEST(RKCancelSource, EachSigintCallsTheHandlerUntilTheSourceGoes) {
    std::atomic<int> calls{0};
    auto source = RKMemspread::installCancelHandler([&] { calls++; });
    ASSERT_TRUE(source);
    struct sigaction action {};
    sigaction(SIGINT, nullptr, &action);
    EXPECT_EQ(action.sa_handler, SIG_IGN) << "a signal handler, not an event";
    for (int sent = 1; sent <= 2; sent++) {
        ASSERT_EQ(::kill(::getpid(), SIGINT), 0);
        for (int waited = 0; calls < sent && waited < 10000; waited++)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    EXPECT_EQ(calls, 2);
    source.reset();
    sigaction(SIGINT, nullptr, &action);
    EXPECT_EQ(action.sa_handler, SIG_DFL);
    sigset_t mask;
    pthread_sigmask(SIG_BLOCK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGINT), 0);
}
