// The sampling timer: a thread that waits for its next deadline on the platform's uptime clock
// and then calls the handler, on that thread, so handlers never overlap. Deadlines that pass
// while the handler runs are not queued: the next call reports how many there were, as a
// repeating timer reports the number of times it fired since its handler last ran.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <thread>

class RKSampleTimer {
public:
    // `fires`: the deadlines reached since the handler last ran (1 when it kept up).
    using Handler = std::function<void(uint64_t fires)>;

    explicit RKSampleTimer(Handler handler) : handler_(std::move(handler)) {}
    // Cancels and waits for a running handler.
    ~RKSampleTimer();
    RKSampleTimer(const RKSampleTimer&) = delete;
    RKSampleTimer& operator=(const RKSampleTimer&) = delete;

    // The first deadline and the interval between deadlines, in uptime nanoseconds. Before
    // resume, or from within the handler to re-arm the timer.
    void setTimer(uint64_t start, uint64_t interval);
    // Starts the thread. Once only.
    void resume();
    // No handler starts after this; a running one finishes. From any thread, also the handler's.
    void cancel();
    // Returns once no handler runs and none will (after cancel). Not from the handler.
    void waitUntilIdle();

private:
    void run();

    Handler handler_;
    std::mutex mutex_;
    std::condition_variable wake_;
    uint64_t next_ = 0;      // the next deadline
    uint64_t interval_ = 1;  // never 0: deadlines always move on
    bool cancelled_ = false;
    std::mutex threadMutex_;  // a stop may race the start: SIGINT is routed before the timer starts
    std::thread thread_;
};
