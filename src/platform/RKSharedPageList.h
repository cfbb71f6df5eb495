// One process's shared anonymous pages, sorted by key and packed: the keys as their differences
// from the previous key, LEB128 varints, then the ranges as a fixed-width array (two bytes while
// the process has fewer than 65,536 ranges, else four), so that only the keys take a branch to
// decode. Sorted frames lie close together, so a record takes about three and a half bytes
// rather than twelve; a forking server holds millions of them from its gathering until the pass
// across processes has read them.
//
// Read forward only, as the pass does: iteration decodes the records one by one, by value.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <iterator>
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
            range_ += wide_ ? 4 : 2;
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
        iterator(const uint8_t* at, const uint8_t* end, const uint8_t* range, bool wide)
            : at_(at), end_(end), range_(range), wide_(wide) {
            decode();
        }
        // Inline, with one and two bytes first: the pass decodes every record several times.
        static uint64_t varint(const uint8_t*& in) {
            uint64_t value = *in++;
            if (value < 0x80) return value;
            value = (value & 0x7F) | uint64_t{*in} << 7;
            if (*in++ < 0x80) return value;
            value &= (uint64_t{1} << 14) - 1;
            for (unsigned shift = 14;; shift += 7) {
                const uint8_t byte = *in++;
                value |= static_cast<uint64_t>(byte & 0x7F) << shift;
                if (!(byte & 0x80)) return value;
            }
        }
        void decode() {
            // Only lists this class packed are read, so every record is whole.
            if (at_ == end_) return;
            const uint8_t* in = at_;
            key_ += varint(in);
            next_ = in;
            uint32_t range = 0;
            if (wide_) {
                std::memcpy(&range, range_, 4);
            } else {
                uint16_t narrow = 0;
                std::memcpy(&narrow, range_, 2);
                range = narrow;
            }
            current_ = RKSharedAnonymousPage(key_, range);
        }

        const uint8_t* at_ = nullptr;  // the key of the current record
        const uint8_t* next_ = nullptr;
        const uint8_t* end_ = nullptr;  // of the keys
        const uint8_t* range_ = nullptr;  // the range of the current record
        bool wide_ = false;
        uint64_t key_ = 0;
        RKSharedAnonymousPage current_;
    };

    RKSharedPageList() = default;
    // Packs `pages`, sorting them by key first when they are not sorted already.
    explicit RKSharedPageList(std::vector<RKSharedAnonymousPage> pages);

    iterator begin() const { return iterator(bytes_.data(), keysEnd(), keysEnd(), wide_); }
    iterator end() const { return iterator(keysEnd(), keysEnd(), nullptr, wide_); }
    size_t size() const { return count_; }
    bool empty() const { return count_ == 0; }
    // Bytes held: 0 once released.
    size_t capacity() const { return bytes_.capacity(); }
    // Frees the records.
    void release();

private:
    const uint8_t* keysEnd() const { return bytes_.data() + keyBytes_; }

    std::vector<uint8_t> bytes_;  // the keys, then the ranges
    size_t keyBytes_ = 0;
    size_t count_ = 0;
    bool wide_ = false;
};
