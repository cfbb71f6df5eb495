#include "driver/RKSampleTimer.h"

#include <pthread.h>

#include <algorithm>

#include "platform/RKPlatform.h"

RKSampleTimer::~RKSampleTimer() {
    cancel();
    waitUntilIdle();
}

void RKSampleTimer::setTimer(uint64_t start, uint64_t interval) {
    std::lock_guard<std::mutex> lock(mutex_);
    next_ = start;
    interval_ = std::max<uint64_t>(interval, 1);
}

void RKSampleTimer::resume() {
    std::lock_guard<std::mutex> lock(threadMutex_);
    thread_ = std::thread([this] { run(); });
}

void RKSampleTimer::cancel() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        cancelled_ = true;
    }
    wake_.notify_all();
}

void RKSampleTimer::waitUntilIdle() {
    std::lock_guard<std::mutex> lock(threadMutex_);
    if (thread_.joinable() && thread_.get_id() != std::this_thread::get_id()) thread_.join();
}

void RKSampleTimer::run() {
    pthread_setname_np(pthread_self(), "sample-timer");
    RKPlatform& platform = RKPlatform::current();
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
        uint64_t now = platform.uptimeNanoseconds();
        while (!cancelled_ && now < next_) {
            platform.waitForUptime(next_, wake_, lock);
            now = platform.uptimeNanoseconds();
        }
        if (cancelled_) return;
        // Every deadline up to now counts as one firing; the next lies after now.
        uint64_t fires = (now - next_) / interval_ + 1;
        next_ += fires * interval_;
        lock.unlock();
        handler_(fires);
        lock.lock();
    }
}
