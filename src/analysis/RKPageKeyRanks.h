// The distinct page keys (frame numbers, or swap entries with RKSwappedPageKey set) of many
// processes, each given its rank in ascending order, so that what is known per page can be kept
// in plain arrays indexed by rank. Frames are bits of a bitmap allocated by chunks of 2^15
// frames, as frames are met (a bit a frame and half a word of counts: 1/64 of a byte a frame
// when dense); swap entries, few in practice, a sorted vector.
#pragma once

#include <cstdint>
#include <memory>
#include <unordered_map>
#include <vector>

class RKPageKeyRanks {
    static constexpr unsigned kChunkShift = 15;
    static constexpr size_t kWords = (size_t{1} << kChunkShift) / 64;
    struct Chunk {
        uint64_t bits[kWords] = {};
        uint32_t before[kWords] = {};  // keys in the chunk's earlier words
        uint32_t base = 0;             // keys in earlier chunks
    };
    // The chunk of the last key asked about: one process's keys come in ascending order.
    struct Cursor {
        uint64_t index = UINT64_MAX;
        Chunk* chunk = nullptr;
    };

public:
    void add(uint64_t key);
    // Adds every key `other` was given, leaving it empty: instances filled side by side, one a
    // thread, become one. Moves the chunks this one lacks, ORs the words of those both have.
    void addAll(RKPageKeyRanks&& other);
    // After the last add, before the first rank.
    void seal();
    size_t size() const { return count_; }

    // The ranks of keys that were added, read through the chunk of the last key asked about;
    // each thread that ranks keys has a reader of its own.
    class Reader {
    public:
        explicit Reader(const RKPageKeyRanks& ranks) : ranks_(ranks) {}
        uint32_t rank(uint64_t key) { return ranks_.rankFrom(key, cursor_); }

    private:
        const RKPageKeyRanks& ranks_;
        Cursor cursor_;
    };

private:
    Chunk& chunk(uint64_t frame);
    const Chunk& chunk(uint64_t frame, Cursor& cursor) const;
    uint32_t rankFrom(uint64_t key, Cursor& cursor) const;

    std::unordered_map<uint64_t, std::unique_ptr<Chunk>> chunks_;
    Cursor addCursor_;
    std::vector<uint64_t> swapped_;
    uint32_t frames_ = 0;
    size_t count_ = 0;
};
