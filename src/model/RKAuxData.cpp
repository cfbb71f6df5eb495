#include "model/RKAuxData.h"

#include "model/RKAssert.h"

RKAuxJsonValue RKAuxData::jsonRepresentation() const {
    RKAuxJsonValue json;
    json.number = value_;
    return json;
}

RKAuxNode RKAuxDataMap::objectForKey(const std::string& key) const {
    auto it = entries_.find(key);
    return it == entries_.end() ? nullptr : it->second;
}

RKAuxJsonValue RKAuxDataMap::jsonRepresentation() const {
    RKAuxJsonValue json;
    json.isObject = true;
    json.members.reserve(entries_.size());
    for (const auto& [key, node] : entries_) json.members.push_back({key, node->jsonRepresentation()});
    return json;
}

std::shared_ptr<RKAuxDataMap> RKAuxDataMap::mergeWithData(const std::shared_ptr<const RKAuxDataMap>& other) const {
    auto merged = std::make_shared<RKAuxDataMap>();
    for (const auto& [key, node] : entries_) {
        RKAuxNode result = mergeAuxDatum(node, other ? other->objectForKey(key) : nullptr);
        if (result) merged->entries_.emplace(key, std::move(result));
    }
    if (other) {
        for (const auto& [key, node] : other->entries_) {
            if (entries_.count(key)) continue;
            RKAuxNode result = mergeAuxDatum(node, nullptr);
            if (result) merged->entries_.emplace(key, std::move(result));
        }
    }
    return merged->entries_.empty() ? nullptr : merged;
}

RKAuxNode RKAuxDataMap::mergeAuxDatum(const RKAuxNode& datum1, const RKAuxNode& datum2) {
    // A leaf and a map under one key cannot come from a well-formed producer.
    RKAssert(!datum2 || datum1->isContainer() == datum2->isContainer(), "RKAuxData",
             "!datum2 || datum1.isContainer == datum2.isContainer");
    if (datum1->isContainer()) {
        const auto& map1 = static_cast<const RKAuxDataMap&>(*datum1);
        return map1.mergeWithData(std::static_pointer_cast<const RKAuxDataMap>(datum2));
    }
    const auto& leaf1 = static_cast<const RKAuxData&>(*datum1);
    if (!leaf1.shouldAggregate()) return nullptr;  // only the first operand's flag counts
    if (!datum2) return datum1;
    const auto& leaf2 = static_cast<const RKAuxData&>(*datum2);
    // Two's-complement sum: wraps rather than being undefined.
    auto sum = static_cast<int64_t>(static_cast<uint64_t>(leaf1.value()) + static_cast<uint64_t>(leaf2.value()));
    return std::make_shared<RKAuxData>(sum, true);
}
