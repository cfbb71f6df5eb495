// A serial queue: tasks run one at a time, in the order they were submitted, on a thread of the
// queue's own. Sampling analyses and writes its samples on one, so that reports never overlap
// and reach the formatters in sample order.
#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>

class RKSerialQueue {
public:
    // The queue's thread is named `label` (as ps and top show threads; 15 bytes at most) and
    // runs `niceIncrement` below the creating thread (quality of service).
    explicit RKSerialQueue(const char* label, int niceIncrement = 0);
    // Runs every task already submitted, then ends the thread.
    ~RKSerialQueue();
    RKSerialQueue(const RKSerialQueue&) = delete;
    RKSerialQueue& operator=(const RKSerialQueue&) = delete;

    // Queues `task` and returns at once.
    void async(std::function<void()> task);
    // Returns once every task submitted before the call has run.
    void sync();
    // Returns once at most `count` tasks wait behind the one running: lets a producer slow down
    // to the queue's pace instead of piling work up.
    void waitUntilWaitingAtMost(size_t count);

private:
    void run(const char* label, int niceIncrement);

    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<std::function<void()>> tasks_;
    bool running_ = false;  // a task is executing
    bool ending_ = false;
    std::thread thread_;
};
