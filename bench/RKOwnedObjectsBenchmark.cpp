// What reading descriptors costs when every process of a machine is measured (-a): a load of
// processes holding a few thousand descriptors (memfds, pipes, /dev/null), then, in one run,
// the whole gathering of every process, the owned-object lists alone, and the floor that any
// descriptor reader pays (listing /proc/PID/fd and one stat per descriptor).
#include <benchmark/benchmark.h>
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <vector>

#include "platform/RKPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKProcess.h"

namespace {

constexpr int kHolders = 40;
constexpr int kDescriptorsPerHolder = 100;  // 4000 in all

// Processes that each hold kDescriptorsPerHolder descriptors: half memfds of one written page,
// the rest pipes and /dev/null. They live until the benchmark program ends.
class DescriptorLoad {
public:
    DescriptorLoad() {
        for (int i = 0; i < kHolders; i++) pids_.push_back(startHolder());
    }
    ~DescriptorLoad() {
        for (pid_t pid : pids_) kill(pid, SIGKILL);
        for (pid_t pid : pids_) waitpid(pid, nullptr, 0);
    }

private:
    static pid_t startHolder() {
        int ready[2];
        if (pipe(ready) != 0) std::abort();
        pid_t pid = fork();
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            for (int d = 0; d < kDescriptorsPerHolder; d += 4) {
                for (int m = 0; m < 2; m++) {
                    int fd = memfd_create("bench", 0);
                    if (fd < 0 || write(fd, "x", 1) != 1) _exit(1);
                }
                int p[2];
                if (pipe(p) != 0 || open("/dev/null", O_RDONLY) < 0) _exit(1);
            }
            char byte = 1;
            if (write(ready[1], &byte, 1) != 1) _exit(1);
            for (;;) pause();
        }
        close(ready[1]);
        char byte;
        if (read(ready[0], &byte, 1) != 1) std::abort();
        close(ready[0]);
        return pid;
    }
    std::vector<pid_t> pids_;
};

DescriptorLoad& load() {
    static DescriptorLoad instance;
    return instance;
}

// The user processes of the system, opened: what -a measures.
std::vector<std::shared_ptr<RKProcess>> allProcesses() {
    std::vector<std::shared_ptr<RKProcess>> processes;
    for (pid_t pid : RKPlatform::current().listAllPids().value_or(std::vector<pid_t>{})) {
        if (pid == 0 || pid == getpid()) continue;
        if (auto process = RKProcess::processWithPid(pid)) processes.push_back(process);
    }
    return processes;
}

uint64_t descriptorCount() {
    uint64_t count = 0;
    for (pid_t pid : RKPlatform::current().listAllPids().value_or(std::vector<pid_t>{})) {
        std::string path = "/proc/" + std::to_string(pid) + "/fd";
        if (DIR* directory = opendir(path.c_str())) {
            while (const dirent* entry = readdir(directory)) count += entry->d_name[0] != '.';
            closedir(directory);
        }
    }
    return count;
}

void reportPerDescriptor(benchmark::State& state, uint64_t descriptors) {
    state.counters["descriptors"] = static_cast<double>(descriptors);
    state.counters["per_descriptor"] = benchmark::Counter(static_cast<double>(descriptors),
                                                          benchmark::Counter::kIsIterationInvariantRate |
                                                              benchmark::Counter::kInvert);
}

// -a's gathering, owned-object lists included (the breakdown on).
void BM_GatherAll(benchmark::State& state) {
    load();
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    const uint64_t descriptors = descriptorCount();
    for (auto _ : state) {
        state.PauseTiming();
        auto processes = allProcesses();
        state.ResumeTiming();
        for (auto& process : processes) process->gatherData();
        state.PauseTiming();
        processes.clear();
        state.ResumeTiming();
    }
    reportPerDescriptor(state, descriptors);
}

// The owned-object lists alone, for the same processes.
void BM_OwnedObjectLists(benchmark::State& state) {
    load();
    const uint64_t descriptors = descriptorCount();
    std::vector<std::unique_ptr<RKTask>> tasks;
    for (pid_t pid : RKPlatform::current().listAllPids().value_or(std::vector<pid_t>{})) {
        std::unique_ptr<RKTask> task;
        if (pid != 0 && RKPlatform::current().taskForPid(pid, task) == KERN_SUCCESS) tasks.push_back(std::move(task));
    }
    std::vector<RKOwnedVmObjectRecord> records;
    size_t found = 0;
    for (auto _ : state) {
        for (auto& task : tasks) {
            RKPlatform::current().ownedVmObjects(*task, records);
            found += records.size();
        }
    }
    benchmark::DoNotOptimize(found);
    reportPerDescriptor(state, descriptors);
}

// The floor: list every process's descriptors and stat each, nothing more.
void BM_DescriptorFloor(benchmark::State& state) {
    load();
    const uint64_t descriptors = descriptorCount();
    std::vector<pid_t> pids = RKPlatform::current().listAllPids().value_or(std::vector<pid_t>{});
    uint64_t blocks = 0;
    for (auto _ : state) {
        for (pid_t pid : pids) {
            std::string path = "/proc/" + std::to_string(pid) + "/fd";
            DIR* directory = opendir(path.c_str());
            if (!directory) continue;
            while (const dirent* entry = readdir(directory)) {
                struct stat st {};
                if (entry->d_name[0] != '.' && fstatat(dirfd(directory), entry->d_name, &st, 0) == 0)
                    blocks += static_cast<uint64_t>(st.st_blocks);
            }
            closedir(directory);
        }
    }
    benchmark::DoNotOptimize(blocks);
    reportPerDescriptor(state, descriptors);
}

}  // namespace

BENCHMARK(BM_GatherAll)->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_OwnedObjectLists)->Unit(benchmark::kMillisecond)->UseRealTime();
BENCHMARK(BM_DescriptorFloor)->Unit(benchmark::kMillisecond)->UseRealTime();
