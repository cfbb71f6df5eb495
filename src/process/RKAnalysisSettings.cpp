#include "process/RKAnalysisSettings.h"

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/RKPlatform.h"

namespace {

enum class Cache : int { Unknown, Off, On };

std::atomic<Cache> gBreakDownCache{Cache::Unknown};
std::atomic<bool> gSharingAnalysisDisabled{false};
std::atomic<bool> gForkSharingDisabled{false};

void printErrno(const char* message, int error) {
    std::fprintf(stderr, "%s: %s\n", message, std::strerror(error));
}

}  // namespace

bool RKAnalysisSettings::breakDownPhysMemspread() {
    Cache cached = gBreakDownCache.load();
    if (cached != Cache::Unknown) return cached == Cache::On;
    int32_t value = 0;
    int error = RKPlatform::current().readSelfRegionMemspread(value);
    if (error != 0) {
        if (error != ENOENT) printErrno("Unable to retrieve status of physical memspread data collection", error);
        value = 0;
    }
    cached = value != 0 ? Cache::On : Cache::Off;
    gBreakDownCache.store(cached);
    return cached == Cache::On;
}

void RKAnalysisSettings::setBreakDownPhysMemspread(bool on) {
    int error = RKPlatform::current().writeSelfRegionMemspread(on ? 1 : 0);
    if (error != 0 && error != ENOENT) printErrno("Unable to configure physical memspread data collection", error);
    gBreakDownCache.store(Cache::Unknown);
}

bool RKAnalysisSettings::isSharingAnalysisDisabled() { return gSharingAnalysisDisabled.load(); }

void RKAnalysisSettings::setSharingAnalysisDisabled(bool disabled) { gSharingAnalysisDisabled.store(disabled); }

bool RKAnalysisSettings::isForkSharingDisabled() { return gForkSharingDisabled.load(); }

void RKAnalysisSettings::setForkSharingDisabled(bool disabled) { gForkSharingDisabled.store(disabled); }

bool RKAnalysisSettings::applyEnvironment(const char* program) {
    const char* value = std::getenv("MEMSPREAD_FORK_SHARING");
    if (!value || std::strcmp(value, "on") == 0) {
        setForkSharingDisabled(false);
    } else if (std::strcmp(value, "off") == 0) {
        setForkSharingDisabled(true);
    } else {
        std::fprintf(stderr, "%s: MEMSPREAD_FORK_SHARING must be on or off, not '%s'\n", program, value);
        return false;
    }
    return true;
}

void RKAnalysisSettings::resetCache() { gBreakDownCache.store(Cache::Unknown); }
