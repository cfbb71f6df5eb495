// The sampling interval and the rule that stretches it when samples take longer than the
// interval: the first overrun is forgiven (start-up costs), each later one grows the interval by
// 110 % of the overshoot. It never shrinks during a run.
#pragma once

#include <cstdint>
#include <optional>

class RKSampleInterval {
public:
    // `start`: the clock's reading at set-up, in nanoseconds.
    RKSampleInterval(uint64_t interval, uint64_t start) : interval_(interval), lastStart_(start) {}

    // A tick starting at `now`, after `fires` deadlines since the previous one. The new interval
    // when it grew (the timer is then re-armed from now), else nothing.
    std::optional<uint64_t> tick(uint64_t fires, uint64_t now);
    uint64_t interval() const { return interval_; }

private:
    uint64_t interval_;
    uint64_t lastStart_;
    bool firstOverrun_ = true;
};
