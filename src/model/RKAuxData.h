// Auxiliary data: named extra measurements of a process (its memspread figures, the kernel's
// counters), a tree of signed leaves grouped in maps. Each process hands its tree to the
// formatters unchanged; the analysis merges the trees of all processes into one report-wide tree,
// in which only leaves that ask to be aggregated survive.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

// The plain value tree of jsonRepresentation: a number, or members in key order.
struct RKAuxJsonValue {
    // A key and its value. Not a std::pair: a pair may not hold the incomplete type it is a
    // member of, which clang's standard library checks.
    struct Member;
    bool isObject = false;
    int64_t number = 0;
    std::vector<Member> members;
};

struct RKAuxJsonValue::Member {
    std::string first;
    RKAuxJsonValue second;
};

class RKAuxDataType {
public:
    virtual ~RKAuxDataType() = default;
    virtual bool isContainer() const = 0;
    virtual RKAuxJsonValue jsonRepresentation() const = 0;
};

using RKAuxNode = std::shared_ptr<const RKAuxDataType>;

// A leaf: one byte count and whether it is summed into the report-wide tree. Immutable.
class RKAuxData : public RKAuxDataType {
public:
    RKAuxData(int64_t value, bool shouldAggregate) : value_(value), aggregate_(shouldAggregate) {}

    int64_t value() const { return value_; }
    bool shouldAggregate() const { return aggregate_; }
    bool isContainer() const override { return false; }
    RKAuxJsonValue jsonRepresentation() const override;

private:
    int64_t value_;
    bool aggregate_;
};

// A map node. Keys are kept sorted, so every formatter prints them in one order. Filled by its
// producer, then immutable once handed to the formatters: merging always builds new maps.
class RKAuxDataMap : public RKAuxDataType {
public:
    using Entries = std::map<std::string, RKAuxNode>;

    RKAuxDataMap() = default;
    explicit RKAuxDataMap(Entries entries) : entries_(std::move(entries)) {}

    const Entries& entries() const { return entries_; }
    RKAuxNode objectForKey(const std::string& key) const;
    void setObject(const std::string& key, RKAuxNode node) { entries_[key] = std::move(node); }
    size_t count() const { return entries_.size(); }

    bool isContainer() const override { return true; }
    RKAuxJsonValue jsonRepresentation() const override;

    // This map merged with `other` (which may be null): this map's leaves decide aggregation
    // at every level, keys only in `other` are taken on their own terms. Null when nothing
    // survives. Neither map changes.
    std::shared_ptr<RKAuxDataMap> mergeWithData(const std::shared_ptr<const RKAuxDataMap>& other) const;

    // Two nodes under one key merged; `datum2` may be null. A leaf and a map under one key is a
    // broken producer and stops the program.
    static RKAuxNode mergeAuxDatum(const RKAuxNode& datum1, const RKAuxNode& datum2);

private:
    Entries entries_;
};
