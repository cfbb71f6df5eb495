// How many tasks may be open at once, so that gathering never runs out of descriptors: each open
// task holds its /proc directory and, while it is read, a few files below it. The budget starts
// from the descriptor limit and shrinks when an open still fails with EMFILE (the rest of the
// program holds more than was assumed). A gatherer waits for a slot rather than failing, so a low
// limit costs speed, never a process.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <mutex>

class RKDescriptorBudget;

// One held slot; gives it back when destroyed.
class RKDescriptorTicket {
public:
    RKDescriptorTicket() = default;
    explicit RKDescriptorTicket(RKDescriptorBudget* budget) : budget_(budget) {}
    ~RKDescriptorTicket() { release(); }
    RKDescriptorTicket(RKDescriptorTicket&& other) noexcept : budget_(other.budget_) { other.budget_ = nullptr; }
    RKDescriptorTicket& operator=(RKDescriptorTicket&& other) noexcept;
    RKDescriptorTicket(const RKDescriptorTicket&) = delete;
    RKDescriptorTicket& operator=(const RKDescriptorTicket&) = delete;

    void release();

private:
    RKDescriptorBudget* budget_ = nullptr;
};

class RKDescriptorBudget {
public:
    // `capacity`: slots to start with (at least 1). `patience`: how long one acquire waits for a
    // slot before it goes ahead anyway, so that a thread that already holds a slot and asks for
    // another can never wait for itself forever.
    explicit RKDescriptorBudget(size_t capacity, std::chrono::milliseconds patience = std::chrono::seconds(10));

    // The budget of this program's tasks, sized from the soft descriptor limit at first use.
    static RKDescriptorBudget& shared();
    // Slots for a soft limit of `limit` descriptors.
    static size_t capacityForLimit(unsigned long long limit);

    // Waits for a free slot; `timedOut`, when given, tells whether the wait ran out of patience
    // (the slot is then over budget).
    RKDescriptorTicket acquire(bool* timedOut = nullptr);
    // An open failed for want of descriptors while `ticket` was held. Returns false when no
    // other slot is held (no one will give a descriptor back: the failure is final); otherwise
    // gives the ticket back, lowers the capacity below what is held now and returns true (the
    // caller acquires again and retries).
    bool shrinkAfterFailure(RKDescriptorTicket& ticket);

    size_t capacity() const;
    size_t inUse() const;

private:
    friend class RKDescriptorTicket;
    void _release();

    mutable std::mutex mutex_;
    std::condition_variable released_;
    size_t capacity_;
    size_t inUse_ = 0;
    std::chrono::milliseconds patience_;
};
