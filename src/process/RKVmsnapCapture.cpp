// Each region is saved twice over: as the record a region query answers (what any reader of the
// format needs) and with the details the live run computed (exact sizes, name, detail,
// subranges), so that analysing the snapshot gives the live run's numbers.
#include "process/RKVmsnapCapture.h"

#include <set>
#include <unordered_map>

#include "model/RKMemoryRegion.h"
#include "model/RKRangeList.h"
#include "process/RKUserProcess.h"

namespace {

bool isImageSegment(const RKMemoryRegion& region) {
    return region.segment == RKSegmentText || region.segment == RKSegmentData || region.segment == RKSegmentLinkedit;
}

RKVmsnapRegionDetails detailsOf(const RKMemoryRegion& region) {
    RKVmsnapRegionDetails details;
    details.name = region.name;
    details.detail = region.detailedName;
    details.dirty = region.dirtySize;
    details.swapped = region.swappedSize;
    details.clean = region.cleanNonSpecSize;
    details.reclaimable = region.reclaimableSize;
    details.wired = region.wired;
    details.ownedExclusivelyByParentProcess = region.ownedExclusivelyByParentProcess;
    if (const RKRangeList* list = region.subrangeList())
        for (const RKRangeListNode& node : list->nodes())
            details.subranges.push_back(
                {node.location, node.length, node.dirty, node.swapped, node.clean, node.reclaimable, node.wired});
    return details;
}

RKVmsnapRegion regionRecord(const RKMemoryRegion& region) {
    RKVmsnapRegion record;
    record.address = region.start;
    record.length = region.size;
    record.offset = region.offset;
    record.user_tag = region.user_tag;
    record.resident_size = region.dirtySize + region.cleanNonSpecSize + region.reclaimableSize;
    record.dirty_size = region.dirtySize;
    record.swapped_out_size = region.swappedSize;
    record.reusable_size = region.reclaimableSize;
    record.share_mode = region.share_mode;
    record.object_id = region.object_id;
    bool file = isImageSegment(region) || region.name == "mapped file";
    record.external_pager = file;
    if (file) record.path = region.detailedName;
    if (isImageSegment(region)) {
        record.type = region.name;
        record.segment = region.segment;
    }
    record.details = detailsOf(region);
    return record;
}

// The process's shared anonymous pages, region by region. The query's list is sorted by key, so
// each region's keys come out ascending.
void captureSharedAnonymousPages(const RKUserProcess& process,
                                 const std::unordered_map<const RKMemoryRegion*, uint32_t>& savedIndex,
                                 RKVmsnapGraph& graph) {
    const auto& regions = process.sharedAnonymousRegions();
    std::vector<int64_t> listOfRange(regions.size(), -1);
    for (const RKSharedAnonymousPage& page : process.sharedAnonymousPages()) {
        if (page.range >= regions.size()) continue;
        int64_t& list = listOfRange[page.range];
        if (list < 0) {
            auto found = savedIndex.find(regions[page.range].get());
            if (found == savedIndex.end()) continue;
            list = static_cast<int64_t>(graph.sharedAnonymousPages.size());
            graph.sharedAnonymousPages.push_back({found->second, {}});
        }
        graph.sharedAnonymousPages[static_cast<size_t>(list)].keys.push_back(page.page());
    }
}

}  // namespace

RKVmsnapGraph RKVmsnapGraphForProcess(const RKUserProcess& process, const std::string& description) {
    RKVmsnapGraph graph;
    graph.pid = process.pid();
    graph.processName = process.name();
    graph.is64bit = process.is64bit();
    graph.processDescriptionString = description;
    graph.vmPageSize = process.pageSize();
    graph.physicalMemspread = process.phys_memspread();
    graph.physicalMemspreadPeak = process.phys_memspread_peak();
    graph.showsPhysMemspread = process.breakDownPhysMemspread();
    std::set<std::string> images;
    std::unordered_map<const RKMemoryRegion*, uint32_t> savedIndex;
    for (const auto& region : process.memoryRegions().value_or(RKRegionList{})) {
        if (region->start == RKRegionNoAddress) {
            RKVmsnapUnaddressedRegion record;
            record.size = region->size;
            record.user_tag = region->user_tag;
            record.object_id = region->object_id;
            record.share_mode = region->share_mode;
            record.offset = region->offset;
            record.details = detailsOf(*region);
            graph.unaddressedRegions.push_back(std::move(record));
            continue;
        }
        if (isImageSegment(*region)) images.insert(region->detailedName);
        savedIndex.emplace(region.get(), static_cast<uint32_t>(graph.regions.size()));
        graph.regions.push_back(regionRecord(*region));
    }
    for (const std::string& image : images) graph.binaryImagesDescription += image + "\n";
    captureSharedAnonymousPages(process, savedIndex, graph);
    graph.unattributedSharedAnonymousBytes = process.unattributedSharedAnonymousBytes();
    return graph;
}
