#include "platform/RKLinuxPlatform.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>

#include "platform/RKDescriptorBudget.h"
#include "platform/RKLinuxFrameVerdicts.h"
#include "platform/RKLinuxOwnedObjects.h"
#include "platform/RKLinuxTask.h"

namespace {

// Linux has no kernel-side accounting switch; the setting lives with the running program.
std::atomic<int32_t> gSelfRegionMemspread{0};

uint64_t nanoseconds(const timespec& ts) {
    return static_cast<uint64_t>(ts.tv_sec) * 1000000000ull + static_cast<uint64_t>(ts.tv_nsec);
}

kern_return_t openFailure(int error) {
    if (error == EACCES || error == EPERM) return KERN_PROTECTION_FAILURE;
    if (error == EMFILE || error == ENFILE) return KERN_RESOURCE_SHORTAGE;
    if (error == ENOENT || error == ESRCH) return KERN_INVALID_ARGUMENT;  // the process is gone
    return KERN_FAILURE;
}

// A higher limit lets more processes be gathered at once (RKDescriptorBudget); a low one only
// makes gathering wait.
void raiseDescriptorLimit() {
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= limit.rlim_max) return;
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
}

}  // namespace

RKLinuxPlatform::RKLinuxPlatform(std::string procRoot, std::string sysRoot)
    : procRoot_(std::move(procRoot)),
      sysRoot_(std::move(sysRoot)),
      sysV_(std::make_shared<RKSysVTableOfGather>(procRoot_)),
      frameVerdicts_(std::make_shared<RKFrameVerdictsOfGather>()) {
    static const bool raised = (raiseDescriptorLimit(), true);
    (void)raised;
}

kern_return_t RKLinuxPlatform::taskForPid(pid_t pid, std::unique_ptr<RKTask>& task) {
    std::string path = procRoot_ + "/" + std::to_string(pid);
    RKDescriptorBudget& budget = RKDescriptorBudget::shared();
    for (;;) {
        bool overBudget = false;
        RKDescriptorTicket ticket = budget.acquire(&overBudget);
        RKUniqueFd directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        // Opening smaps is the kernel's ptrace-read check: without it nothing can be measured.
        RKUniqueFd smaps;
        if (directory.valid()) smaps.reset(::openat(directory.get(), "smaps", O_RDONLY | O_CLOEXEC));
        if (smaps.valid()) {
            task = std::make_unique<RKLinuxTask>(pid, std::move(directory), std::move(ticket));
            return KERN_SUCCESS;
        }
        const int error = errno;
        // Out of descriptors while other tasks are open: wait for one of them to close. Not when
        // the wait already ran out: the holders may be this very thread.
        const bool outOfDescriptors = error == EMFILE || error == ENFILE;
        if (outOfDescriptors && !overBudget && budget.shrinkAfterFailure(ticket)) continue;
        return openFailure(error);
    }
}

int RKLinuxPlatform::readSelfRegionMemspread(int32_t& value) {
    value = gSelfRegionMemspread.load();
    return 0;
}

int RKLinuxPlatform::writeSelfRegionMemspread(int32_t value) {
    gSelfRegionMemspread.store(value);
    return 0;
}

bool RKLinuxPlatform::getTimes(RKClockReadings& readings) {
    timespec monotonic{}, boottime{}, realtime{};
    if (clock_gettime(CLOCK_MONOTONIC, &monotonic) != 0) return false;
    if (clock_gettime(CLOCK_BOOTTIME, &boottime) != 0) return false;
    if (clock_gettime(CLOCK_REALTIME, &realtime) != 0) return false;
    readings.absolute = nanoseconds(monotonic);
    readings.continuous = nanoseconds(boottime);
    readings.wallSeconds = realtime.tv_sec;
    readings.wallNanoseconds = realtime.tv_nsec;
    return true;
}

RKTimebase RKLinuxPlatform::timebase() { return RKTimebase{1, 1}; }

uint64_t RKLinuxPlatform::uptimeNanoseconds() {
    timespec monotonic{};
    clock_gettime(CLOCK_MONOTONIC, &monotonic);  // cannot fail for this clock
    return nanoseconds(monotonic);
}

// steady_clock is CLOCK_MONOTONIC, the uptime clock, so the wait ends at the deadline itself.
void RKLinuxPlatform::waitForUptime(uint64_t deadline, std::condition_variable& wake,
                                    std::unique_lock<std::mutex>& lock) {
    uint64_t now = uptimeNanoseconds();
    if (now >= deadline) return;
    wake.wait_for(lock, std::chrono::nanoseconds(deadline - now));
}

uint64_t RKLinuxPlatform::kernelPageSize() {
    static const uint64_t pageSize = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
    return pageSize;
}

uid_t RKLinuxPlatform::effectiveUserId() { return ::geteuid(); }

pid_t RKLinuxPlatform::ownPid() { return ::getpid(); }
