#include "analysis/RKPageKeyRanks.h"

#include <algorithm>
#include <bit>

#include "model/RKAssert.h"
#include "platform/RKKernelTypes.h"

RKPageKeyRanks::Chunk& RKPageKeyRanks::chunk(uint64_t frame) {
    const uint64_t index = frame >> kChunkShift;
    if (index != addCursor_.index) {
        std::unique_ptr<Chunk>& slot = chunks_[index];
        if (!slot) slot = std::make_unique<Chunk>();
        addCursor_ = {index, slot.get()};
    }
    return *addCursor_.chunk;
}

const RKPageKeyRanks::Chunk& RKPageKeyRanks::chunk(uint64_t frame, Cursor& cursor) const {
    const uint64_t index = frame >> kChunkShift;
    if (index != cursor.index) {
        auto found = chunks_.find(index);
        RKAssert(found != chunks_.end(), "RKPageKeyRanks", "rank of a frame that was never added");
        cursor = {index, found->second.get()};
    }
    return *cursor.chunk;
}

void RKPageKeyRanks::add(uint64_t key) {
    if (key & RKSwappedPageKey) {
        swapped_.push_back(key);
        return;
    }
    const uint64_t offset = key & ((uint64_t{1} << kChunkShift) - 1);
    chunk(key).bits[offset / 64] |= uint64_t{1} << (offset % 64);
}

void RKPageKeyRanks::addAll(RKPageKeyRanks&& other) {
    for (auto& [index, theirs] : other.chunks_) {
        std::unique_ptr<Chunk>& slot = chunks_[index];
        if (!slot) {
            slot = std::move(theirs);
            continue;
        }
        for (size_t w = 0; w < kWords; w++) slot->bits[w] |= theirs->bits[w];
    }
    swapped_.insert(swapped_.end(), other.swapped_.begin(), other.swapped_.end());
    other = RKPageKeyRanks();
}

void RKPageKeyRanks::seal() {
    std::vector<uint64_t> order;
    order.reserve(chunks_.size());
    for (const auto& [index, chunk] : chunks_) order.push_back(index);
    std::sort(order.begin(), order.end());
    uint64_t total = 0;
    for (uint64_t index : order) {
        Chunk& c = *chunks_[index];
        c.base = static_cast<uint32_t>(total);
        uint32_t within = 0;
        for (size_t w = 0; w < kWords; w++) {
            c.before[w] = within;
            within += static_cast<uint32_t>(std::popcount(c.bits[w]));
        }
        total += within;
    }
    std::sort(swapped_.begin(), swapped_.end());
    swapped_.erase(std::unique(swapped_.begin(), swapped_.end()), swapped_.end());
    RKAssert(total + swapped_.size() <= UINT32_MAX, "RKPageKeyRanks", "more than 2^32 distinct pages");
    frames_ = static_cast<uint32_t>(total);
    count_ = total + swapped_.size();
}

// Called for every page of every process: where the processor counts bits in one instruction
// (nearly every x86-64 processor made since 2008), that instruction, not a library routine.
// Not under the sanitizers: the clone is chosen while the program is being loaded, before their
// runtime is ready (ThreadSanitizer's builds crashed there).
#if defined(__x86_64__) && defined(__GNUC__) && !defined(__clang__) && !defined(__SANITIZE_THREAD__) && \
    !defined(__SANITIZE_ADDRESS__)
__attribute__((target_clones("popcnt", "default")))
#endif
uint32_t RKPageKeyRanks::rankFrom(uint64_t key, Cursor& cursor) const {
    if (key & RKSwappedPageKey)
        return frames_ + static_cast<uint32_t>(std::lower_bound(swapped_.begin(), swapped_.end(), key) - swapped_.begin());
    const Chunk& c = chunk(key, cursor);
    const uint64_t offset = key & ((uint64_t{1} << kChunkShift) - 1);
    const uint64_t below = c.bits[offset / 64] & ((uint64_t{1} << (offset % 64)) - 1);
    return c.base + c.before[offset / 64] + static_cast<uint32_t>(std::popcount(below));
}
