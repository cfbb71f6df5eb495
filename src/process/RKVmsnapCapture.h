// A gathered live process as vmsnap records: what `vmsnap` saves.
#pragma once

#include <string>

#include "process/RKVmsnapGraph.h"

class RKUserProcess;

// The graph of a gathered process. `description` names the platform, machine and kernel (it must
// contain "Linux" for the snapshot to be read as one of this platform).
RKVmsnapGraph RKVmsnapGraphForProcess(const RKUserProcess& process, const std::string& description);
