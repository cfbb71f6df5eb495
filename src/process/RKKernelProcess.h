// The kernel as a process: pid 0, the record that carries PROC_FLAG_SYSTEM. It has no address
// space to walk; its memory is reported from the kernel's own accounting, its counters as
// auxiliary data.
#pragma once

#include <memory>

#include "process/RKProcess.h"

class RKKernelProcess : public RKProcess {
public:
    RKKernelProcess() = default;

    // Base initialisation, then idle-exit status 1 (never managed) and empty counters.
    bool initWithBsdInfo(const RKBsdInfo& info) override;
    bool _populateTask() override { return true; }  // nothing to open
    bool _isAlive() const override { return true; }

    // NOT YET BUILT: the kernel's memory (slab caches, vmalloc sites, counters) is read in a
    // later step. Until then gathering yields no regions and a warning that says so.
    void gatherData() override;

    // { "Maps": the counters }.
    std::shared_ptr<RKAuxDataMap> auxData() const override;

private:
    std::shared_ptr<RKAuxDataMap> counters_;
};
