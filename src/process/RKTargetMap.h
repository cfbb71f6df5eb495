// The result of target selection: process objects by key. A live process's key is its pid;
// a snapshot's key is derived from its path.
#pragma once

#include <cstdint>
#include <map>
#include <memory>

class RKProcess;

using RKTargetMap = std::map<int64_t, std::shared_ptr<RKProcess>>;
