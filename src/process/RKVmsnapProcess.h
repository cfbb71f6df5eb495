// A process measured from a saved vmsnap file instead of a live task. It behaves like a live
// user process whose kernel has been replaced by the snapshot: the same walk callback builds its
// regions and the same shared-region splitting runs, but region counters, images, phys
// memspread and the analysis mode come from the file, and nothing that needs a running process
// is asked.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "model/RKError.h"
#include "process/RKUserProcess.h"
#include "process/RKVmsnapGraph.h"

class RKVmsnapProcess : public RKUserProcess {
public:
    // The process of the file at `path`, or none with the read error or an error of the domain
    // "MemspreadErrorDomain" (1: the file is not a snapshot this program reads; 2: its platform
    // is not recognised).
    static std::shared_ptr<RKVmsnapProcess> processWithVmsnap(const std::string& path, RKError* error);
    bool initWithVmsnap(const std::string& path, RKError* error);
    // The same from the file's bytes.
    bool initWithVmsnapData(std::string_view bytes, RKError* error);

    const RKVmsnapGraph& graph() const { return graph_; }

    uint64_t _gatherPageSize() override;
    bool _populateTask() override { return true; }  // there is no task
    bool _reopenTaskForGathering() override { return true; }
    bool _isAlive() const override { return false; }
    void _gatherIsTranslated() override;
    void _gatherImageData() override {}  // images come with the regions
    std::optional<RKOwnedVmObjectMap> _gatherOwnedVmObjects() override { return std::nullopt; }
    void _gatherPhysMemspread() override;
    bool breakDownPhysMemspread() const override { return graph_.showsPhysMemspread; }
    void _addSubrangesForRegion(RKMemoryRegion&, int) override {}  // saved subranges come with the region
    // Sizes a shared-region piece from the record's byte counts.
    bool _populateMemoryRegionWithPageQueries(RKMemoryRegion& region, const RKRegionSubmapInfo& info) override;
    void enumerateRegions(const RKRegionCallback& callback) override;
    void _completeRegion(RKMemoryRegion& region) override;
    // The saved shared anonymous pages, on the regions built from their saved regions.
    void _gatherSharedAnonymousPages(RKRegionWalkState& state) override;
    // The saved regions that have no address.
    void _addUnconsumedOwnedObjectRegions(RKRegionWalkState& state) override;

private:
    bool _choosePlatform(RKError* error);

    RKVmsnapGraph graph_;
    const RKVmsnapRegion* current_ = nullptr;  // the saved region the walk is handing over
    // The region built from each saved region, for the walk's duration (not owned).
    std::vector<const RKMemoryRegion*> builtRegions_;
};
