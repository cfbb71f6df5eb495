#include "platform/RKWorkerPool.h"

#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <system_error>
#include <thread>
#include <vector>

void RKAddThreadNiceness(int increment) {
    if (increment <= 0) return;
    id_t tid = static_cast<id_t>(::syscall(SYS_gettid));
    errno = 0;
    int current = ::getpriority(PRIO_PROCESS, tid);
    if (current == -1 && errno != 0) return;
    ::setpriority(PRIO_PROCESS, tid, std::min(current + increment, 19));
}

size_t RKOnlineCpuCount() {
    long cpus = ::sysconf(_SC_NPROCESSORS_ONLN);
    return cpus > 0 ? static_cast<size_t>(cpus) : 1;
}

void RKParallelApply(size_t count, const RKWorkerPoolOptions& options, const std::function<void(size_t)>& work) {
    std::atomic<size_t> next{0};
    auto worker = [&] {
        RKAddThreadNiceness(options.niceIncrement);
        for (size_t i; (i = next.fetch_add(1)) < count;) work(i);
    };
    std::vector<std::thread> workers;
    size_t wanted = std::min(std::max<size_t>(options.threads, 1), count);
    for (size_t i = 0; i < wanted; i++) {
        try {
            workers.emplace_back(worker);
        } catch (const std::system_error&) {
            break;  // the ones that started take all the work
        }
    }
    if (workers.empty() && count > 0) {
        for (size_t i; (i = next.fetch_add(1)) < count;) work(i);  // no thread at all: do it here
    }
    for (auto& thread : workers) thread.join();
}

void RKParallelApplyOnEveryCpu(size_t count, const std::function<void(size_t)>& work) {
    RKWorkerPoolOptions options;
    options.threads = RKOnlineCpuCount();
    RKParallelApply(count, options, work);
}
