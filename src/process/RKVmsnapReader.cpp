// Reading a vmsnap file: bytes to records. nlohmann-json parses the text (Debian's well-kept
// parser, with clear positions in its errors); this file checks every member it takes, so a
// damaged or hand-edited file ends in an error that names the member, never in a crash.
#include <nlohmann/json.hpp>

#include <limits>

#include "platform/RKKernelTypes.h"
#include "process/RKVmsnapCompression.h"
#include "process/RKVmsnapGraph.h"

namespace {

using Json = nlohmann::json;

// The largest text a snapshot may decompress to: far above any process seen (a few MB), low
// enough that a forged size cannot exhaust memory.
constexpr size_t kTextLimit = size_t{1} << 31;
// The most shared anonymous pages a snapshot may list (64 GiB of 4 KiB pages): each becomes a
// 12-byte record, so a forged count must not decide how much memory a read takes.
constexpr uint64_t kSharedPageLimit = uint64_t{1} << 24;

struct ParseFailure {
    std::string reason;
};

[[noreturn]] void fail(const std::string& where, const std::string& what) { throw ParseFailure{where + what}; }

const Json* member(const Json& object, const char* key) {
    auto it = object.find(key);
    return it == object.end() || it->is_null() ? nullptr : &*it;
}

uint64_t unsignedMember(const Json& object, const char* key, const std::string& where, uint64_t fallback = 0,
                        uint64_t max = std::numeric_limits<uint64_t>::max()) {
    const Json* value = member(object, key);
    if (!value) return fallback;
    if (!value->is_number_unsigned() && !(value->is_number_integer() && value->get<int64_t>() >= 0))
        fail(where, std::string("\"") + key + "\" is not an unsigned integer");
    uint64_t result = value->get<uint64_t>();
    if (result > max) fail(where, std::string("\"") + key + "\" is out of range");
    return result;
}

int64_t signedMember(const Json& object, const char* key, const std::string& where, int64_t fallback, int64_t min,
                     int64_t max) {
    const Json* value = member(object, key);
    if (!value) return fallback;
    if (!value->is_number_integer()) fail(where, std::string("\"") + key + "\" is not an integer");
    if (value->is_number_unsigned() && value->get<uint64_t>() > static_cast<uint64_t>(max))
        fail(where, std::string("\"") + key + "\" is out of range");
    int64_t result = value->get<int64_t>();
    if (result < min || result > max) fail(where, std::string("\"") + key + "\" is out of range");
    return result;
}

bool boolMember(const Json& object, const char* key, const std::string& where) {
    const Json* value = member(object, key);
    if (!value) return false;
    if (!value->is_boolean()) fail(where, std::string("\"") + key + "\" is not true or false");
    return value->get<bool>();
}

std::string stringMember(const Json& object, const char* key, const std::string& where) {
    const Json* value = member(object, key);
    if (!value) return {};
    if (!value->is_string()) fail(where, std::string("\"") + key + "\" is not a string");
    return value->get<std::string>();
}

const Json& objectAt(const Json& value, const std::string& where) {
    if (!value.is_object()) fail(where, "is not an object");
    return value;
}

const Json* arrayMember(const Json& object, const char* key, const std::string& where) {
    const Json* value = member(object, key);
    if (value && !value->is_array()) fail(where, std::string("\"") + key + "\" is not an array");
    return value;
}

void checkRange(uint64_t start, uint64_t length, const std::string& where, const char* what) {
    if (length > std::numeric_limits<uint64_t>::max() - start) fail(where, std::string(what) + " wraps around the address space");
}

RKVmsnapSubrange readSubrange(const Json& value, const std::string& where) {
    if (!value.is_array() || value.size() != 7) fail(where, "is not an array of 7 numbers");
    uint64_t numbers[7];
    for (size_t i = 0; i < 7; i++) {
        if (!value[i].is_number_unsigned()) fail(where, "holds a value that is not an unsigned integer");
        numbers[i] = value[i].get<uint64_t>();
    }
    RKVmsnapSubrange subrange{numbers[0], numbers[1], numbers[2], numbers[3], numbers[4], numbers[5], numbers[6]};
    checkRange(subrange.offset, subrange.length, where, "the subrange");
    return subrange;
}

RKVmsnapRegionDetails readDetails(const Json& value, const std::string& where) {
    objectAt(value, where);
    RKVmsnapRegionDetails details;
    details.name = stringMember(value, "name", where);
    details.detail = stringMember(value, "detail", where);
    details.dirty = unsignedMember(value, "dirty", where);
    details.swapped = unsignedMember(value, "swapped", where);
    details.clean = unsignedMember(value, "clean", where);
    details.reclaimable = unsignedMember(value, "reclaimable", where);
    details.wired = boolMember(value, "wired", where);
    details.ownedExclusivelyByParentProcess = boolMember(value, "ownedExclusivelyByParentProcess", where);
    if (const Json* subranges = arrayMember(value, "subranges", where)) {
        details.subranges.reserve(subranges->size());
        for (size_t i = 0; i < subranges->size(); i++)
            details.subranges.push_back(readSubrange((*subranges)[i], where + "subrange " + std::to_string(i) + " "));
    }
    return details;
}

RKVmsnapRegion readRegion(const Json& value, const std::string& where) {
    objectAt(value, where);
    RKVmsnapRegion region;
    region.address = unsignedMember(value, "address", where);
    region.length = unsignedMember(value, "length", where);
    checkRange(region.address, region.length, where, "the region");
    if (region.length == 0) fail(where, "is empty");
    region.prot = static_cast<int32_t>(signedMember(value, "prot", where, 0, 0, 0xFF));
    region.maxProt = static_cast<int32_t>(signedMember(value, "maxProt", where, 0, 0, 0xFF));
    region.offset = unsignedMember(value, "offset", where);
    checkRange(region.offset, region.length, where, "the region's offset");
    region.user_tag = static_cast<uint32_t>(unsignedMember(value, "user_tag", where, 0, 0xFFFFFFFF));
    region.resident_size = unsignedMember(value, "resident_size", where);
    region.shared_now_private_size = unsignedMember(value, "shared_now_private_size", where);
    region.swapped_out_size = unsignedMember(value, "swapped_out_size", where);
    region.dirty_size = unsignedMember(value, "dirty_size", where);
    region.reusable_size = unsignedMember(value, "reusable_size", where);
    region.ref_count = static_cast<uint16_t>(unsignedMember(value, "ref_count", where, 0, 0xFFFF));
    region.external_pager = boolMember(value, "external_pager", where);
    region.share_mode = static_cast<uint8_t>(unsignedMember(value, "share_mode", where, 0, 0xFF));
    region.is_submap = boolMember(value, "is_submap", where);
    region.object_id = unsignedMember(value, "object_id", where);
    region.purgeable = static_cast<int32_t>(signedMember(value, "purgeable", where, 3, 0, 3));
    region.path = stringMember(value, "path", where);
    region.type = stringMember(value, "type", where);
    region.segment = static_cast<uint8_t>(unsignedMember(value, "segment", where, 0, 4));
    if (const Json* details = member(value, "details")) region.details = readDetails(*details, where + "details ");
    return region;
}

RKVmsnapUnaddressedRegion readUnaddressed(const Json& value, const std::string& where) {
    objectAt(value, where);
    RKVmsnapUnaddressedRegion region;
    region.size = unsignedMember(value, "size", where);
    region.user_tag = static_cast<uint32_t>(unsignedMember(value, "user_tag", where, 0, 0xFFFFFFFF));
    region.object_id = unsignedMember(value, "object_id", where);
    region.share_mode = static_cast<uint8_t>(unsignedMember(value, "share_mode", where, 0, 0xFF));
    region.offset = unsignedMember(value, "offset", where);
    checkRange(region.offset, region.size, where, "the region's offset");
    const Json* details = member(value, "details");
    if (!details) fail(where, "has no \"details\"");
    region.details = readDetails(*details, where + "details ");
    return region;
}

// Each region's shared pages: [region, key, difference to the next key, ...], keys ascending,
// each a frame number or a swap entry, no more of them in a region than it has pages.
void readSharedPages(const Json& lists, RKVmsnapGraph& graph) {
    std::vector<uint64_t> pagesPerRegion(graph.regions.size(), 0);
    uint64_t total = 0;
    for (size_t i = 0; i < lists.size(); i++) {
        const std::string where = "shared pages " + std::to_string(i) + " ";
        const Json& value = lists[i];
        if (!value.is_array() || value.size() < 2) fail(where, "is not an array of a region and its pages");
        for (const Json& number : value)
            if (!number.is_number_unsigned()) fail(where, "holds a value that is not an unsigned integer");
        const uint64_t region = value[0].get<uint64_t>();
        if (region >= graph.regions.size()) fail(where, "names a region the snapshot does not have");
        const uint64_t count = value.size() - 1;
        const uint64_t regionPages = graph.regions[region].length / graph.vmPageSize + 1;
        if (count > regionPages || (pagesPerRegion[region] += count) > regionPages)
            fail(where, "holds more pages than its region");
        if ((total += count) > kSharedPageLimit) fail(where, "is past the most shared pages a snapshot may hold");
        RKVmsnapSharedPages pages{static_cast<uint32_t>(region), {}};
        pages.keys.reserve(count);
        uint64_t key = 0;
        for (size_t k = 1; k < value.size(); k++) {
            const uint64_t difference = value[k].get<uint64_t>();
            if (difference > std::numeric_limits<uint64_t>::max() - key) fail(where, "goes past the largest key");
            key += difference;
            if (key & RKVmsnapPageKeyMark) fail(where, "holds a key that is no frame number or swap entry");
            pages.keys.push_back(key);
        }
        graph.sharedAnonymousPages.push_back(std::move(pages));
    }
}

RKVmsnapGraph readGraph(const Json& document) {
    const std::string top;
    if (!document.is_object()) fail(top, "not a vmsnap (the document is not an object)");
    if (stringMember(document, "format", top) != "memspread-vmsnap") fail(top, "not a memspread vmsnap");
    RKVmsnapGraph graph;
    graph.version = signedMember(document, "version", top, -1, std::numeric_limits<int64_t>::min(),
                                 std::numeric_limits<int64_t>::max());
    if (graph.version < 1 || graph.version > RKVmsnapVersion)
        fail(top, "unsupported version " + std::to_string(graph.version) + " (this memspread reads versions 1 to " +
                      std::to_string(RKVmsnapVersion) + ")");
    graph.pid = static_cast<int32_t>(signedMember(document, "pid", top, 0, std::numeric_limits<int32_t>::min(),
                                                  std::numeric_limits<int32_t>::max()));
    graph.processName = stringMember(document, "processName", top);
    graph.is64bit = member(document, "is64bit") ? boolMember(document, "is64bit", top) : true;
    graph.processDescriptionString = stringMember(document, "processDescription", top);
    graph.binaryImagesDescription = stringMember(document, "binaryImagesDescription", top);
    graph.vmPageSize = unsignedMember(document, "vmPageSize", top);
    if (graph.vmPageSize < 512 || graph.vmPageSize > (uint64_t{1} << 30) || (graph.vmPageSize & (graph.vmPageSize - 1)))
        fail(top, "\"vmPageSize\" is not a page size (a power of two from 512 bytes to 1 GiB)");
    graph.physicalMemspread = unsignedMember(document, "physicalMemspread", top);
    graph.physicalMemspreadPeak = unsignedMember(document, "physicalMemspreadPeak", top);
    graph.showsPhysMemspread = boolMember(document, "showsPhysMemspread", top);
    if (const Json* regions = arrayMember(document, "regions", top)) {
        graph.regions.reserve(regions->size());
        uint64_t previousEnd = 0;
        for (size_t i = 0; i < regions->size(); i++) {
            std::string where = "region " + std::to_string(i) + " ";
            graph.regions.push_back(readRegion((*regions)[i], where));
            const RKVmsnapRegion& region = graph.regions.back();
            // The walk sizes shared pages in address order: overlaps or disorder would corrupt it.
            if (i > 0 && region.address < previousEnd) fail(where, "overlaps or precedes the region before it");
            previousEnd = region.address + region.length;
        }
    }
    if (const Json* regions = arrayMember(document, "unaddressedRegions", top)) {
        graph.unaddressedRegions.reserve(regions->size());
        for (size_t i = 0; i < regions->size(); i++)
            graph.unaddressedRegions.push_back(readUnaddressed((*regions)[i], "unaddressed region " + std::to_string(i) + " "));
    }
    if (const Json* runs = arrayMember(document, "sharedAnonymousPages", top)) readSharedPages(*runs, graph);
    graph.unattributedSharedAnonymousBytes = unsignedMember(document, "unattributedSharedAnonymousBytes", top);
    return graph;
}

}  // namespace

std::optional<RKVmsnapGraph> RKVmsnapParse(std::string_view bytes, RKError* error) {
    auto failed = [&](const std::string& reason) {
        RKError::set(error, RKVmsnapErrorDomain, 1, "vmsnap initialization failed: " + reason);
        return std::nullopt;
    };
    std::string decompressed;
    std::string_view text = bytes;
    if (RKVmsnapIsCompressed(bytes)) {
        std::string reason;
        auto plain = RKVmsnapDecompress(bytes, kTextLimit, reason);
        if (!plain) return failed(reason);
        decompressed = std::move(*plain);
        text = decompressed;
    }
    try {
        Json document = Json::parse(text.begin(), text.end());
        return readGraph(document);
    } catch (const ParseFailure& failure) {
        return failed(failure.reason);
    } catch (const Json::exception& exception) {
        return failed(std::string("not valid JSON (") + exception.what() + ")");
    } catch (const std::bad_alloc&) {
        return failed("out of memory");
    }
}
