// The regions of one memory object. Nearly every object has exactly one region, so the first is
// held in place and a vector is made only when a second one comes. The regions are contiguous
// either way: iterators are plain pointers and the list converts to a span.
#pragma once

#include <cstddef>
#include <memory>
#include <vector>

class RKMemoryRegion;

class RKObjectRegions {
public:
    using value_type = std::shared_ptr<RKMemoryRegion>;
    using const_iterator = const value_type*;

    RKObjectRegions() = default;
    RKObjectRegions(const RKObjectRegions& other)
        : one_(other.one_), many_(other.many_ ? std::make_unique<std::vector<value_type>>(*other.many_) : nullptr) {}
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
            many_ = std::make_unique<std::vector<value_type>>();
            many_->reserve(2);
            many_->push_back(std::move(one_));
        }
        many_->push_back(std::move(region));
    }

    const value_type* data() const { return many_ ? many_->data() : &one_; }
    size_t size() const { return many_ ? many_->size() : one_ != nullptr; }
    bool empty() const { return size() == 0; }
    const_iterator begin() const { return data(); }
    const_iterator end() const { return data() + size(); }
    const value_type& front() const { return *data(); }
    const value_type& operator[](size_t i) const { return data()[i]; }

private:
    value_type one_;  // while there is no vector
    std::unique_ptr<std::vector<value_type>> many_;
};
