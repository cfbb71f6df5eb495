// One process's shared anonymous pages, sorted by key and packed: each record is its key's
// difference from the previous key, then its range, both as LEB128 varints. Sorted frames lie
// close together, so a record takes about three bytes rather than twelve; a forking server holds
// millions of them from its gathering until the pass across processes has read them.
//
// Read forward only, as the pass does: iteration decodes the records one by one, by value.
#pragma once

#include <cstddef>
#include <cstdint>
#include <iterator>
#include <span>
#include <vector>

#include "platform/RKKernelTypes.h"

class RKSharedPageList {
public:
    class iterator {
    public:
        using iterator_category = std::input_iterator_tag;
        using value_type = RKSharedAnonymousPage;
        using difference_type = std::ptrdiff_t;
        using pointer = const RKSharedAnonymousPage*;
        using reference = RKSharedAnonymousPage;

        iterator() = default;
        RKSharedAnonymousPage operator*() const { return current_; }
        iterator& operator++() {
            at_ = next_;
            decode();
            return *this;
        }
        iterator operator++(int) {
            iterator before = *this;
            ++*this;
            return before;
        }
        bool operator==(const iterator& other) const { return at_ == other.at_; }

    private:
        friend class RKSharedPageList;
        iterator(const uint8_t* at, const uint8_t* end) : at_(at), end_(end) { decode(); }
        void decode();

        const uint8_t* at_ = nullptr;
        const uint8_t* next_ = nullptr;
        const uint8_t* end_ = nullptr;
        uint64_t key_ = 0;
        RKSharedAnonymousPage current_;
    };

    RKSharedPageList() = default;
    // Packs `pages`, sorting them by key first when they are not sorted already.
    explicit RKSharedPageList(std::vector<RKSharedAnonymousPage> pages);

    iterator begin() const { return iterator(bytes_.data(), bytes_.data() + bytes_.size()); }
    iterator end() const { return iterator(bytes_.data() + bytes_.size(), bytes_.data() + bytes_.size()); }
    size_t size() const { return count_; }
    bool empty() const { return count_ == 0; }
    // Bytes held: 0 once released.
    size_t capacity() const { return bytes_.capacity(); }
    // Frees the records.
    void release();

private:
    std::vector<uint8_t> bytes_;
    size_t count_ = 0;
};
