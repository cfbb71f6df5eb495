// The kernel as a process: pid 0, the record that carries PROC_FLAG_SYSTEM. It has no address
// space to walk; its memory is reported from the kernel's own accounting (the platform's
// memoryInfo): one region per zone allocator (on Linux: slab cache), one per wired-memory site,
// and the kernel's counters as auxiliary data.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/RKKernelMemoryInfo.h"
#include "process/RKProcess.h"

class RKKernelProcess : public RKProcess {
public:
    // Loaded modules by load tag: their names.
    using RKKextTags = std::map<uint64_t, std::string>;

    RKKernelProcess() = default;

    // Base initialisation, then idle-exit status 1 (never managed) and empty counters.
    bool initWithBsdInfo(const RKBsdInfo& info) override;
    bool _populateTask() override { return true; }  // nothing to open
    bool _isAlive() const override { return true; }

    // Fills the regions and the counters from the platform's memoryInfo.
    void gatherData() override;
    // One region per site that is not a counter (appended to `regions`), one counter per
    // counter site.
    void _addWiredData(const std::vector<RKMemoryInfoRecord>& sites, const std::vector<RKZoneName>& zoneNames,
                       const RKKextTags& kexts, RKRegionList& regions);

    // The name of a site: its own name when it carries one, else by its type; with zone names
    // and the zone bit, followed by "[zone]".
    static std::string _nameForWiredInfo(const RKMemoryInfoRecord& site, const RKKextTags& kexts,
                                         const std::vector<RKZoneName>* zoneNames);

    // { "Maps": the counters }.
    std::shared_ptr<RKAuxDataMap> auxData() const override;
    // A counter's value (a /proc/meminfo figure in bytes on Linux), nothing when not reported.
    std::optional<int64_t> counter(const std::string& name) const;

private:
    std::shared_ptr<RKAuxDataMap> counters_;
};
