// Runs work(0) .. work(count - 1) on a pool of worker threads and returns when all have run:
// the concurrent apply of gathering. Items are taken in index order, each by one worker.
#pragma once

#include <cstddef>
#include <functional>

struct RKWorkerPoolOptions {
    size_t threads = 1;     // at most this many workers (never more than there are items)
    int niceIncrement = 0;  // added to each worker's niceness (Linux nice is per thread)
};

void RKParallelApply(size_t count, const RKWorkerPoolOptions& options, const std::function<void(size_t)>& work);

// Lowers the calling thread's priority by `increment`; never raises it (that needs privilege).
void RKAddThreadNiceness(int increment);

// One worker per online CPU.
size_t RKOnlineCpuCount();

// RKParallelApply with one worker per online CPU at the caller's priority: the analysis's
// side-by-side steps.
void RKParallelApplyOnEveryCpu(size_t count, const std::function<void(size_t)>& work);
