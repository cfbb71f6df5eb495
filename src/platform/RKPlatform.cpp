#include "platform/RKPlatform.h"

#include <atomic>
#include <mutex>
#include <string>

#include "platform/RKErrorCapture.h"
#include "platform/RKLinuxPlatform.h"

namespace {

std::mutex& currentMutex() {
    static std::mutex mutex;
    return mutex;
}

// Owns the platform; changed only under the mutex.
std::shared_ptr<RKPlatform>& currentSlot() {
    static std::shared_ptr<RKPlatform> platform;
    return platform;
}

// What current() answers without the lock: every region of every walk asks, from every worker.
std::atomic<RKPlatform*> gCurrent{nullptr};

}  // namespace

RKPlatform& RKPlatform::current() {
    if (RKPlatform* platform = gCurrent.load(std::memory_order_acquire)) return *platform;
    std::lock_guard<std::mutex> lock(currentMutex());
    auto& slot = currentSlot();
    if (!slot) {
        slot = std::make_shared<RKLinuxPlatform>();
        gCurrent.store(slot.get(), std::memory_order_release);
    }
    return *slot;
}

std::shared_ptr<RKPlatform> RKPlatform::setCurrent(std::shared_ptr<RKPlatform> platform) {
    std::lock_guard<std::mutex> lock(currentMutex());
    auto previous = std::move(currentSlot());
    currentSlot() = std::move(platform);
    gCurrent.store(currentSlot().get(), std::memory_order_release);
    return previous;
}

const char* mach_error_string(kern_return_t code) {
    switch (code) {
        case KERN_SUCCESS: return "success";
        case KERN_INVALID_ADDRESS: return "address is not mapped";
        case KERN_PROTECTION_FAILURE: return "permission denied";
        case KERN_INVALID_ARGUMENT: return "process is gone";
        case KERN_FAILURE: return "failure";
        case KERN_RESOURCE_SHORTAGE: return "too many open files";
        case KERN_NOT_SUPPORTED: return "not supported";
        case MACH_SEND_INVALID_DEST: return "process is gone";
        default: return "unknown error";
    }
}

void mach_error(const char* label, kern_return_t code) {
    RKWriteError(std::string(label) + ": " + mach_error_string(code) + "\n");
}
