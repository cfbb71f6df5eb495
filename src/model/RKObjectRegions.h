// The regions of one memory object. Nearly every object has exactly one region, so the first is
// held in place and a block is made only when a second one comes: the regions' vector, and with
// it what only an object of two or more regions can need (its extras). The regions are contiguous
// either way: iterators are plain pointers and the list converts to a span.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <map>
#include <memory>
#include <vector>

#include "model/RKRangeList.h"

class RKMemoryRegion;

// The regions of each process (by pid) that map one object.
using RKProcessRegionMap = std::map<pid_t, std::vector<std::shared_ptr<RKMemoryRegion>>>;

class RKObjectRegions {
public:
    using value_type = std::shared_ptr<RKMemoryRegion>;
    using const_iterator = const value_type*;

    // What the object keeps only once it has two or more regions: a range list needs two regions
    // with pages, per-process views two processes. So these live in the block that the second
    // region brings, not in every object (nearly one per mapping). Each is null until made.
    struct Extras {
        std::unique_ptr<RKRangeList> rangeList;               // while collecting
        std::unique_ptr<RKProcessRegionMap> processRegions;  // for per-process views
    };

    RKObjectRegions() = default;
    // A copy holds the same regions and no extras: they belong to the object that made them.
    RKObjectRegions(const RKObjectRegions& other)
        : one_(other.one_), many_(other.many_ ? std::make_unique<Many>(other.many_->regions) : nullptr) {}
    RKObjectRegions& operator=(const RKObjectRegions& other) {
        if (this != &other) *this = RKObjectRegions(other);
        return *this;
    }
    RKObjectRegions(RKObjectRegions&&) noexcept = default;
    RKObjectRegions& operator=(RKObjectRegions&&) noexcept = default;

    void push_back(value_type region) {
        if (!many_ && !one_) {
            one_ = std::move(region);
            return;
        }
        if (!many_) {
            many_ = std::make_unique<Many>();
            many_->regions.reserve(2);
            many_->regions.push_back(std::move(one_));
        }
        many_->regions.push_back(std::move(region));
    }

    const value_type* data() const { return many_ ? many_->regions.data() : &one_; }
    size_t size() const { return many_ ? many_->regions.size() : one_ != nullptr; }
    bool empty() const { return size() == 0; }
    const_iterator begin() const { return data(); }
    const_iterator end() const { return data() + size(); }
    const value_type& front() const { return *data(); }
    const value_type& operator[](size_t i) const { return data()[i]; }

    // Null while there are fewer than two regions.
    Extras* extras() { return many_ ? &many_->extras : nullptr; }
    const Extras* extras() const { return many_ ? &many_->extras : nullptr; }

private:
    struct Many {
        Many() = default;
        explicit Many(const std::vector<value_type>& copied) : regions(copied) {}
        std::vector<value_type> regions;
        Extras extras;
    };

    value_type one_;  // while there is no block
    std::unique_ptr<Many> many_;
};
