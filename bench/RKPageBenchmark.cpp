// Page-level work on live processes: gathering a process that holds 1 GiB resident in a shared
// memfd (mapped over 1.5 GiB, so the region is worth splitting), and gathering every process of
// the machine plus 300 forked workers that share memory. Each is timed with subranges
// ("pages") and with sharing analysis off, which skips exactly the page work ("floor"); the
// ratio pages/floor and the page work's share (pages − floor) / pages go in docs/performance.md.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <vector>

#include "platform/RKPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

const size_t kPage = static_cast<size_t>(sysconf(_SC_PAGESIZE));

// Children that hold memory until this program ends.
class Load {
public:
    ~Load() {
        for (pid_t pid : pids) kill(pid, SIGKILL);
        for (pid_t pid : pids) waitpid(pid, nullptr, 0);
    }
    // One process mapping `mapped` bytes of a shared memfd, `resident` of them written; with
    // `workers` children that share it and write one page each of it.
    pid_t start(size_t mapped, size_t resident, int workers) {
        int ready[2];
        if (pipe(ready) != 0) return -1;
        pid_t pid = fork();
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            int fd = memfd_create("memspread-bench", 0);
            if (fd < 0 || ftruncate(fd, static_cast<off_t>(mapped)) != 0) _exit(1);
            auto* p = static_cast<char*>(mmap(nullptr, mapped, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0));
            for (size_t i = 0; i < resident; i += kPage) p[i] = 1;
            for (int w = 0; w < workers; w++) {
                if (fork() == 0) {
                    prctl(PR_SET_PDEATHSIG, SIGKILL);
                    p[resident + static_cast<size_t>(w) * kPage] = 2;
                    for (;;) pause();
                }
            }
            char byte = 1;
            if (write(ready[1], &byte, 1) != 1) _exit(1);
            for (;;) pause();
        }
        close(ready[1]);
        char byte;
        bool ok = read(ready[0], &byte, 1) == 1;
        close(ready[0]);
        pids.push_back(pid);
        return ok ? pid : -1;
    }
    std::vector<pid_t> pids;
};

void gather(benchmark::State& state, const std::vector<pid_t>& pids) {
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    RKAnalysisSettings::setSharingAnalysisDisabled(state.range(0) == 0);
    for (auto _ : state) {
        for (pid_t pid : pids) {
            auto process = RKProcess::processWithPid(pid);
            if (process) process->gatherData();
            benchmark::DoNotOptimize(process);
        }
    }
    RKAnalysisSettings::setSharingAnalysisDisabled(false);
    state.SetLabel(state.range(0) ? "pages" : "floor");
}

void BM_GatherMemfdGiB(benchmark::State& state) {
    static Load load;
    static pid_t pid = load.start(1536u << 20, 1024u << 20, 0);
    gather(state, {pid});
}
BENCHMARK(BM_GatherMemfdGiB)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

void BM_GatherAllProcesses(benchmark::State& state) {
    static Load load;
    static bool started = load.start(64u << 20, 32u << 20, 300) > 0;
    benchmark::DoNotOptimize(started);
    std::vector<pid_t> pids;
    for (pid_t pid : RKPlatform::current().listAllPids().value_or(std::vector<pid_t>{}))
        if (pid != 0 && pid != getpid()) pids.push_back(pid);
    state.counters["processes"] = static_cast<double>(pids.size());
    gather(state, pids);
}
BENCHMARK(BM_GatherAllProcesses)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);

}  // namespace
