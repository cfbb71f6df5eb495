// A set of pointers for "each object once" walks over every region of every process: open
// addressing in one array, no allocation per element. Hundreds of thousands of objects are
// met in each of those walks; a node-based set spent most of the walk allocating.
#pragma once

#include <cstdint>
#include <vector>

class RKPointerSet {
public:
    explicit RKPointerSet(size_t expected = 0) { rehash(capacityFor(expected)); }

    // True when `pointer` (never null) was not in the set.
    bool insert(const void* pointer) {
        if ((count_ + 1) * 2 > slots_.size()) rehash(slots_.size() * 2);
        if (!place(slots_, pointer)) return false;
        count_++;
        return true;
    }
    size_t size() const { return count_; }

private:
    static size_t capacityFor(size_t expected) {
        size_t capacity = 16;
        while (capacity < expected * 2) capacity *= 2;
        return capacity;
    }
    static bool place(std::vector<const void*>& slots, const void* pointer) {
        const size_t mask = slots.size() - 1;
        // Fibonacci hashing of the address without its alignment bits.
        size_t at = static_cast<size_t>((reinterpret_cast<uintptr_t>(pointer) >> 4) * 0x9E3779B97F4A7C15ull) & mask;
        for (; slots[at]; at = (at + 1) & mask)
            if (slots[at] == pointer) return false;
        slots[at] = pointer;
        return true;
    }
    void rehash(size_t capacity) {
        std::vector<const void*> larger(capacity, nullptr);
        for (const void* pointer : slots_)
            if (pointer) place(larger, pointer);
        slots_.swap(larger);
    }

    std::vector<const void*> slots_;
    size_t count_ = 0;
};

// Whether a walk over every region of every process meets `object` once only. A region is in
// one process's list only, so an object of one region is met once, through that region: most
// objects of a forking server, which then need no place in a set or a map of the walk.
template <class Object>
bool RKMetOnce(const Object& object) {
    return object.memoryRegions().size() == 1;
}

// In such a walk, whether `object` is met for the first time.
template <class Object>
bool RKFirstMeeting(RKPointerSet& seen, const Object& object) {
    return RKMetOnce(object) || seen.insert(&object);
}
