// The pass that counts fork-shared anonymous memory once, at the scale of a big worker pool:
// a parent with 1000 mappings of 16 written pages forks 400 workers (401 processes, about
// 400 000 mappings, 6.5 million shared page records). Gathering is not timed; the pass is,
// with the records it starts from and its peak memory beyond them.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <vector>

#include "analysis/RKSharedAnonymousPass.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

const size_t kPage = static_cast<size_t>(sysconf(_SC_PAGESIZE));
constexpr int kMappings = 1000;
constexpr size_t kPagesPerMapping = 16;
constexpr int kWorkers = 400;

uint64_t selfStatus(const char* field) {
    std::ifstream in("/proc/self/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind(field, 0) == 0) return std::stoull(line.substr(std::string(field).size())) * 1024;
    return 0;
}

// The worker pool, killed when the benchmark program ends.
struct Pool {
    std::vector<pid_t> pids;
    Pool() {
        int ready[2];
        if (pipe(ready) != 0) return;
        pid_t parent = fork();
        if (parent == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            for (int m = 0; m < kMappings; m++) {
                // Guard pages between mappings keep the kernel from merging them.
                auto* area = static_cast<char*>(mmap(nullptr, (kPagesPerMapping + 1) * kPage, PROT_READ | PROT_WRITE,
                                                     MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
                mprotect(area + kPagesPerMapping * kPage, kPage, PROT_NONE);
                for (size_t i = 0; i < kPagesPerMapping; i++) area[i * kPage] = static_cast<char>(m);
            }
            for (int w = 0; w < kWorkers; w++)
                if (fork() == 0) {
                    for (;;) pause();
                }
            char byte = 1;
            if (write(ready[1], &byte, 1) != 1) _exit(1);
            for (;;) pause();
        }
        close(ready[1]);
        char byte;
        if (read(ready[0], &byte, 1) != 1) return;
        pids.push_back(parent);
        std::ifstream children("/proc/" + std::to_string(parent) + "/task/" + std::to_string(parent) + "/children");
        for (pid_t child; children >> child;) pids.push_back(child);
    }
    ~Pool() {
        for (pid_t pid : pids) kill(pid, SIGKILL);
        waitpid(pids.empty() ? 0 : pids.front(), nullptr, 0);
    }
};

void BM_SharedAnonymousPass(benchmark::State& state) {
    static Pool pool;
    RKAnalysisSettings::setBreakDownPhysMemspread(true);
    for (auto _ : state) {
        state.PauseTiming();
        std::vector<std::shared_ptr<RKProcess>> processes;
        uint64_t records = 0;
        for (pid_t pid : pool.pids) {
            auto process = RKProcess::processWithPid(pid);
            if (!process) continue;
            process->gatherData();
            records += std::dynamic_pointer_cast<RKUserProcess>(process)->sharedAnonymousPages().size();
            processes.push_back(process);
        }
        std::ofstream("/proc/self/clear_refs") << "5";  // peak resident size starts from here
        const uint64_t before = selfStatus("VmRSS:");
        state.ResumeTiming();
        RKSharedAnonymousSummary summary = RKAttributeSharedAnonymousPages(processes);
        state.PauseTiming();
        const uint64_t peak = selfStatus("VmHWM:");
        state.counters["processes"] = static_cast<double>(processes.size());
        state.counters["records"] = static_cast<double>(records);
        state.counters["sharedPages"] = static_cast<double>(summary.sharedPages);
        state.counters["recordBytes"] = static_cast<double>(records * sizeof(RKSharedAnonymousPage));
        state.counters["peakBeyondRecords"] = static_cast<double>(peak > before ? peak - before : 0);
        processes.clear();
        state.ResumeTiming();
    }
}
BENCHMARK(BM_SharedAnonymousPass)->Unit(benchmark::kMillisecond)->Iterations(2);

}  // namespace
