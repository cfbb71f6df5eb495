// Writing a vmsnap file: records to bytes. Members at their default value are left out, which
// keeps files small and lets hand-made snapshots state only what matters.
#include <nlohmann/json.hpp>

#include <utility>

#include "process/RKVmsnapCompression.h"
#include "process/RKVmsnapGraph.h"

namespace {

using Json = nlohmann::json;

template <typename T>
void put(Json& object, const char* key, const T& value, const T& fallback = T{}) {
    if (!(value == fallback)) object[key] = value;
}

Json detailsJson(const RKVmsnapRegionDetails& details) {
    Json object = Json::object();
    put(object, "name", details.name);
    put(object, "detail", details.detail);
    put(object, "dirty", details.dirty);
    put(object, "swapped", details.swapped);
    put(object, "clean", details.clean);
    put(object, "reclaimable", details.reclaimable);
    put(object, "wired", details.wired);
    put(object, "ownedExclusivelyByParentProcess", details.ownedExclusivelyByParentProcess);
    if (!details.subranges.empty()) {
        Json subranges = Json::array();
        for (const RKVmsnapSubrange& s : details.subranges)
            subranges.push_back({s.offset, s.length, s.dirty, s.swapped, s.clean, s.reclaimable, s.wired});
        object["subranges"] = std::move(subranges);
    }
    return object;
}

Json regionJson(const RKVmsnapRegion& region) {
    Json object = Json::object();
    object["address"] = region.address;
    object["length"] = region.length;
    put(object, "prot", region.prot);
    put(object, "maxProt", region.maxProt);
    put(object, "offset", region.offset);
    put(object, "user_tag", region.user_tag);
    put(object, "resident_size", region.resident_size);
    put(object, "shared_now_private_size", region.shared_now_private_size);
    put(object, "swapped_out_size", region.swapped_out_size);
    put(object, "dirty_size", region.dirty_size);
    put(object, "reusable_size", region.reusable_size);
    put(object, "ref_count", region.ref_count);
    put(object, "external_pager", region.external_pager);
    put(object, "share_mode", region.share_mode);
    put(object, "is_submap", region.is_submap);
    put(object, "object_id", region.object_id);
    put(object, "purgeable", region.purgeable, 3);
    put(object, "path", region.path);
    put(object, "type", region.type);
    put(object, "segment", region.segment);
    if (region.details) object["details"] = detailsJson(*region.details);
    return object;
}

}  // namespace

std::string RKVmsnapSerialize(const RKVmsnapGraph& graph) {
    Json document = Json::object();
    document["format"] = "memspread-vmsnap";
    document["version"] = graph.version;
    document["pid"] = graph.pid;
    document["processName"] = graph.processName;
    document["is64bit"] = graph.is64bit;
    document["processDescription"] = graph.processDescriptionString;
    put(document, "binaryImagesDescription", graph.binaryImagesDescription);
    document["vmPageSize"] = graph.vmPageSize;
    document["physicalMemspread"] = graph.physicalMemspread;
    document["physicalMemspreadPeak"] = graph.physicalMemspreadPeak;
    document["showsPhysMemspread"] = graph.showsPhysMemspread;
    Json regions = Json::array();
    for (const RKVmsnapRegion& region : graph.regions) regions.push_back(regionJson(region));
    document["regions"] = std::move(regions);
    Json unaddressed = Json::array();
    for (const RKVmsnapUnaddressedRegion& region : graph.unaddressedRegions) {
        Json object = Json::object();
        object["size"] = region.size;
        put(object, "user_tag", region.user_tag);
        put(object, "object_id", region.object_id);
        put(object, "share_mode", region.share_mode);
        put(object, "offset", region.offset);
        object["details"] = detailsJson(region.details);
        unaddressed.push_back(std::move(object));
    }
    document["unaddressedRegions"] = std::move(unaddressed);
    if (!graph.sharedAnonymousPages.empty()) {
        Json runs = Json::array();
        // Keys as differences from the one before: frames of one region lie near each other,
        // and small numbers are what keeps the list small.
        for (const RKVmsnapSharedPages& pages : graph.sharedAnonymousPages) {
            Json list = Json::array({pages.region});
            uint64_t previous = 0;
            for (uint64_t key : pages.keys) list.push_back(key - std::exchange(previous, key));
            runs.push_back(std::move(list));
        }
        document["sharedAnonymousPages"] = std::move(runs);
    }
    put(document, "unattributedSharedAnonymousBytes", graph.unattributedSharedAnonymousBytes);
    // Names and paths come from other processes and need not be UTF-8: replace what is not.
    return RKVmsnapCompress(document.dump(-1, ' ', false, Json::error_handler_t::replace) + "\n");
}
