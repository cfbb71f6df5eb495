// Gathering orchestration: every process gathered once on niced workers, the cancel flag read
// before each process, the early-exit error, the time stamps, the cached breakdown setting,
// and SIGINT delivered as an event.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <set>
#include <thread>

#include "analysis/RKCancelSource.h"
#include "analysis/RKMemspread.h"
#include "analysis/RKWorkerPool.h"
#include "platform/RKScriptedPlatform.h"

namespace {

constexpr const char* kEarlyExit = "Memspread exited early due to SIGINT and did not finish gathering all data";

// A process whose gathering is a hook the test sets; it marks itself gathered with no regions.
class RKHookProcess : public RKProcess {
public:
    std::function<void()> hook;
    std::atomic<int> gathered{0};
    int niceness = 0;
    std::thread::id thread;

    void gatherData() override {
        gathered++;
        errno = 0;
        niceness = ::getpriority(PRIO_PROCESS, static_cast<id_t>(::syscall(SYS_gettid)));
        thread = std::this_thread::get_id();
        if (hook) hook();
        setMemoryRegions(RKRegionList{});
    }
};

std::vector<std::shared_ptr<RKHookProcess>> makeProcesses(std::initializer_list<pid_t> pids) {
    std::vector<std::shared_ptr<RKHookProcess>> processes;
    for (pid_t pid : pids) {
        processes.push_back(std::make_shared<RKHookProcess>());
        processes.back()->setPid(pid);
    }
    return processes;
}

RKProcessList asList(const std::vector<std::shared_ptr<RKHookProcess>>& processes) {
    return RKProcessList(processes.begin(), processes.end());
}

// Installs a scripted platform whose clock advances on every reading.
struct GatherPlatform {
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scope{platform};
    GatherPlatform() {
        platform->clocks.absolute = 1000;
        platform->clocks.continuous = 2000;
        RKAnalysisSettings::resetCache();
    }
    ~GatherPlatform() { RKAnalysisSettings::resetCache(); }
};

int ownNiceness() {
    errno = 0;
    return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::syscall(SYS_gettid)));
}

}  // namespace

TEST(RKGather, CancelBeforeGatheringGathersNothingAndFlagsTheLowestPid) {
    GatherPlatform scripted;
    auto processes = makeProcesses({300, 5, 4000});
    RKMemspread memspread(asList(processes));
    memspread.cancel();
    EXPECT_TRUE(memspread.gatherData());
    for (const auto& process : processes) {
        EXPECT_EQ(process->gathered, 0);
        EXPECT_FALSE(process->memoryRegions());
    }
    EXPECT_EQ(processes[1]->globalErrors(), std::vector<std::string>{kEarlyExit});
    EXPECT_TRUE(processes[0]->globalErrors().empty());
    EXPECT_TRUE(processes[2]->globalErrors().empty());
    EXPECT_TRUE(memspread.gatherStartTime() && memspread.gatherEndTime());
    EXPECT_EQ(memspread.processes()[0]->pid(), 300);  // the given order is kept
}

TEST(RKGather, AnEmptyListGathersNothingButIsStamped) {
    GatherPlatform scripted;
    RKMemspread memspread({});
    EXPECT_FALSE(memspread.gatherData());
    ASSERT_TRUE(memspread.gatherStartTime());
    ASSERT_TRUE(memspread.gatherEndTime());
    EXPECT_EQ(scripted.platform->callCount("getTimes"), 2u);
}

TEST(RKGather, EveryProcessIsGatheredOnceOnNicedWorkersBetweenTheStamps) {
    GatherPlatform scripted;
    std::vector<std::shared_ptr<RKHookProcess>> processes;
    for (pid_t pid = 1; pid <= 40; pid++) processes.push_back(makeProcesses({pid * 7 % 41})[0]);
    // Each gathering moves the clock on, so the end stamp must come after all of them.
    std::mutex clockMutex;
    for (auto& process : processes)
        process->hook = [&] {
            std::lock_guard<std::mutex> lock(clockMutex);
            scripted.platform->clocks.absolute += 10;
            scripted.platform->clocks.continuous += 10;
        };
    RKMemspread memspread(asList(processes));
    ASSERT_EQ(memspread.qualityOfService(), QOS_CLASS_UTILITY);
    EXPECT_FALSE(memspread.gatherData());
    std::set<std::thread::id> threads;
    for (const auto& process : processes) {
        EXPECT_EQ(process->gathered, 1);
        EXPECT_TRUE(process->memoryRegions());
        EXPECT_TRUE(process->globalErrors().empty());
        EXPECT_EQ(process->niceness, std::min(ownNiceness() + 5, 19));
        EXPECT_NE(process->thread, std::this_thread::get_id());
        threads.insert(process->thread);
    }
    EXPECT_LE(threads.size(), RKOnlineCpuCount());
    EXPECT_EQ(memspread.gatherStartTime()->machAbsoluteTime(), 1000u);
    EXPECT_EQ(memspread.gatherEndTime()->machAbsoluteTime(), 1000u + 40 * 10);

    // User-initiated gathering runs at the caller's own priority.
    auto again = makeProcesses({10, 20});
    RKMemspread sampling(asList(again));
    sampling.setQualityOfService(QOS_CLASS_USER_INITIATED);
    sampling.gatherData();
    EXPECT_EQ(again[0]->niceness, ownNiceness());
}

// A cancel while gathering: the processes already started finish, later ones are skipped.
TEST(RKGather, CancelDuringGatheringSkipsTheProcessesNotYetStarted) {
    GatherPlatform scripted;
    size_t workers = RKOnlineCpuCount();
    std::vector<std::shared_ptr<RKHookProcess>> processes;
    for (size_t i = 0; i < workers + 5; i++) processes.push_back(makeProcesses({static_cast<pid_t>(100 + i)})[0]);
    RKMemspread memspread(asList(processes));
    std::atomic<bool> cancelled{false};
    auto& highest = processes.back();
    highest->hook = [&] {
        memspread.cancel();
        cancelled = true;
    };
    // The others stay busy until the cancel, so at most one per worker can have started.
    for (auto& process : processes)
        if (process != highest)
            process->hook = [&] {
                auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
                while (!cancelled && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
            };
    EXPECT_TRUE(memspread.gatherData());
    size_t gathered = 0;
    for (const auto& process : processes) {
        gathered += process->gathered;
        EXPECT_EQ(process->gathered > 0, process->memoryRegions().has_value());
    }
    EXPECT_EQ(highest->gathered, 1);
    EXPECT_LE(gathered, workers);
    EXPECT_EQ(processes.front()->gathered, 0);
    EXPECT_EQ(processes.front()->globalErrors(), std::vector<std::string>{kEarlyExit});
}

TEST(RKGather, TheBreakdownSettingIsAskedOnceUntilItIsSet) {
    GatherPlatform scripted;
    EXPECT_FALSE(RKMemspread::breakDownPhysMemspread());
    EXPECT_FALSE(RKMemspread::breakDownPhysMemspread());
    EXPECT_EQ(scripted.platform->callCount("readSelfRegionMemspread"), 1u);
    RKMemspread::setBreakDownPhysMemspread(true);
    EXPECT_EQ(scripted.platform->selfRegionValue, 1);
    EXPECT_TRUE(RKMemspread::breakDownPhysMemspread());
    EXPECT_TRUE(RKMemspread::breakDownPhysMemspread());
    EXPECT_EQ(scripted.platform->callCount("readSelfRegionMemspread"), 2u);

    // A kernel without the setting reads as off and says nothing; other failures say why.
    RKMemspread::setBreakDownPhysMemspread(false);
    scripted.platform->selfRegionValue = 1;
    scripted.platform->selfRegionReadErrno = ENOENT;
    testing::internal::CaptureStderr();
    EXPECT_FALSE(RKMemspread::breakDownPhysMemspread());
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
    RKAnalysisSettings::resetCache();
    scripted.platform->selfRegionReadErrno = EPERM;
    testing::internal::CaptureStderr();
    EXPECT_FALSE(RKMemspread::breakDownPhysMemspread());
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              std::string("Unable to retrieve status of physical memspread data collection: ") + strerror(EPERM) +
                  "\n");
    scripted.platform->selfRegionWriteErrno = EPERM;
    testing::internal::CaptureStderr();
    RKMemspread::setBreakDownPhysMemspread(true);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              std::string("Unable to configure physical memspread data collection: ") + strerror(EPERM) + "\n");
}

namespace {

bool waitFor(const std::atomic<int>& counter, int value) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (counter < value && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    return counter >= value;
}

bool sigintBlockedHere() {
    sigset_t mask;
    pthread_sigmask(SIG_BLOCK, nullptr, &mask);
    return sigismember(&mask, SIGINT) == 1;
}

}  // namespace

TEST(RKCancelSource, EachSigintCallsTheHandlerOnItsOwnThreadUntilCancelled) {
    ASSERT_FALSE(sigintBlockedHere());
    std::atomic<int> calls{0};
    std::thread::id handlerThread;
    auto source = RKMemspread::installCancelHandler([&] {
        handlerThread = std::this_thread::get_id();
        calls++;
    });
    ASSERT_TRUE(source);
    struct sigaction action {};
    sigaction(SIGINT, nullptr, &action);
    EXPECT_EQ(action.sa_handler, SIG_IGN);

    ASSERT_EQ(::kill(::getpid(), SIGINT), 0);
    ASSERT_TRUE(waitFor(calls, 1));
    ASSERT_EQ(::kill(::getpid(), SIGINT), 0);  // a second SIGINT calls it again
    ASSERT_TRUE(waitFor(calls, 2));
    EXPECT_NE(handlerThread, std::this_thread::get_id());

    source.reset();  // cancelled: default action back, SIGINT no longer blocked here
    sigaction(SIGINT, nullptr, &action);
    EXPECT_EQ(action.sa_handler, SIG_DFL);
    EXPECT_FALSE(sigintBlockedHere());
    EXPECT_EQ(calls, 2);
}

TEST(RKCancelSource, AHandlerMayCancelItsOwnSource) {
    std::atomic<int> calls{0};
    std::unique_ptr<RKCancelSource> source;
    std::mutex sourceMutex;
    {
        std::lock_guard<std::mutex> lock(sourceMutex);
        source = RKCancelSource::install([&] {
            std::lock_guard<std::mutex> lock(sourceMutex);
            source->cancel();
            calls++;
        });
    }
    ASSERT_TRUE(source);
    ASSERT_EQ(::kill(::getpid(), SIGINT), 0);
    ASSERT_TRUE(waitFor(calls, 1));
    std::lock_guard<std::mutex> lock(sourceMutex);
    EXPECT_TRUE(source->isCancelled());
    struct sigaction action {};
    sigaction(SIGINT, nullptr, &action);
    EXPECT_EQ(action.sa_handler, SIG_DFL);
    // Cancelled on another thread than the installer's: SIGINT stays blocked here until the
    // installer unblocks it.
    EXPECT_TRUE(sigintBlockedHere());
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}
