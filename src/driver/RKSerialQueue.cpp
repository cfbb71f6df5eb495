#include "driver/RKSerialQueue.h"

#include <pthread.h>

#include "platform/RKWorkerPool.h"

RKSerialQueue::RKSerialQueue(const char* label, int niceIncrement)
    : thread_([this, label, niceIncrement] { run(label, niceIncrement); }) {}

RKSerialQueue::~RKSerialQueue() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        ending_ = true;
    }
    changed_.notify_all();
    thread_.join();
}

void RKSerialQueue::async(std::function<void()> task) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        tasks_.push_back(std::move(task));
    }
    changed_.notify_all();
}

void RKSerialQueue::sync() {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return tasks_.empty() && !running_; });
}

void RKSerialQueue::waitUntilWaitingAtMost(size_t count) {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this, count] { return tasks_.size() <= count; });
}

void RKSerialQueue::run(const char* label, int niceIncrement) {
    pthread_setname_np(pthread_self(), label);
    RKAddThreadNiceness(niceIncrement);
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
        changed_.wait(lock, [this] { return !tasks_.empty() || ending_; });
        if (tasks_.empty()) return;  // ending, and nothing left to run
        std::function<void()> task = std::move(tasks_.front());
        tasks_.pop_front();
        running_ = true;
        lock.unlock();
        changed_.notify_all();  // a producer waiting for room may go on
        task();
        task = nullptr;  // what the task held (a whole sample) goes now, not at the next one
        lock.lock();
        running_ = false;
        changed_.notify_all();
    }
}
