#include "driver/RKSampleInterval.h"

std::optional<uint64_t> RKSampleInterval::tick(uint64_t fires, uint64_t now) {
    std::optional<uint64_t> grown;
    // Two or more deadlines since the last tick: at least one passed while the last sample ran.
    if (fires >= 2) {
        if (firstOverrun_) {
            firstOverrun_ = false;
        } else if (uint64_t elapsed = now - lastStart_; elapsed > interval_) {
            interval_ += static_cast<uint64_t>(static_cast<double>(elapsed - interval_) * 1.1);
            grown = interval_;
        }
    }
    lastStart_ = now;
    return grown;
}
