#include "platform/RKDescriptorBudget.h"

#include <sys/resource.h>

#include <algorithm>

namespace {

// Descriptors left to the rest of the program: standard streams, output files, the files the
// walk reads once per run (mountinfo, the memfd probe) and a margin.
constexpr unsigned long long kReservedDescriptors = 24;
// Descriptors one open task may hold at once: its directory and the files read below it.
constexpr unsigned long long kDescriptorsPerTask = 4;
constexpr size_t kMaximumCapacity = 4096;

}  // namespace

RKDescriptorTicket& RKDescriptorTicket::operator=(RKDescriptorTicket&& other) noexcept {
    if (this != &other) {
        release();
        budget_ = other.budget_;
        other.budget_ = nullptr;
    }
    return *this;
}

void RKDescriptorTicket::release() {
    if (budget_) budget_->_release();
    budget_ = nullptr;
}

RKDescriptorBudget::RKDescriptorBudget(size_t capacity, std::chrono::milliseconds patience)
    : capacity_(std::max<size_t>(capacity, 1)), patience_(patience) {}

size_t RKDescriptorBudget::capacityForLimit(unsigned long long limit) {
    if (limit <= kReservedDescriptors + kDescriptorsPerTask) return 1;
    unsigned long long slots = (limit - kReservedDescriptors) / kDescriptorsPerTask;
    return static_cast<size_t>(std::min<unsigned long long>(slots, kMaximumCapacity));
}

RKDescriptorBudget& RKDescriptorBudget::shared() {
    static RKDescriptorBudget budget([] {
        rlimit limit{};
        if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur == RLIM_INFINITY)
            return kMaximumCapacity;
        return capacityForLimit(limit.rlim_cur);
    }());
    return budget;
}

RKDescriptorTicket RKDescriptorBudget::acquire(bool* timedOut) {
    std::unique_lock<std::mutex> lock(mutex_);
    const bool free = released_.wait_for(lock, patience_, [this] { return inUse_ < capacity_; });
    if (timedOut) *timedOut = !free;
    inUse_++;
    return RKDescriptorTicket(this);
}

bool RKDescriptorBudget::shrinkAfterFailure(RKDescriptorTicket& ticket) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        const size_t others = inUse_ - 1;
        if (others == 0) return false;
        capacity_ = std::min(capacity_, others);
    }
    ticket.release();
    return true;
}

size_t RKDescriptorBudget::capacity() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return capacity_;
}

size_t RKDescriptorBudget::inUse() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return inUse_;
}

void RKDescriptorBudget::_release() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        inUse_--;
    }
    released_.notify_one();
}
