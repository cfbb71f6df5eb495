// One gather of every measured process, on the current platform, for the lifetime of the
// object: what is the system's rather than a process's (the SysV table) is then read once for
// all of them, not once per process.
#pragma once

#include "platform/RKPlatform.h"

class RKGatherScope {
public:
    RKGatherScope() : platform_(RKPlatform::current()) { platform_.beginGather(); }
    ~RKGatherScope() { platform_.endGather(); }
    RKGatherScope(const RKGatherScope&) = delete;
    RKGatherScope& operator=(const RKGatherScope&) = delete;

private:
    RKPlatform& platform_;
};
