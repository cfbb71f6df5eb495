// Whether physical frames are held by more than one mapping, read from /proc/kpagecount and
// /proc/kpageflags at most once a frame in one gather. After fork every process holds the same
// frames; reading them once per process made the kernel do the same work hundreds of times on
// a forking server (and most of a measurement's time).
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <span>
#include <string>
#include <unordered_map>

class RKFrameVerdicts {
public:
    // `frames` ascending. Sets `shared[i]` to 1 when frame `frames[i]` is mapped more than once
    // and is no zero page, else 0. Frames whose verdict is not known yet are read from the two open
    // files, in runs over nearby frames; the verdicts of every frame read are kept. False when a
    // read fails (a frame past the end of memory): those frames' verdicts stay unknown and
    // answer false.
    bool shared(int kpagecount, int kpageflags, std::span<const uint64_t> frames, std::span<uint8_t> shared);

private:
    // 2^15 frames: two bits each (known, shared), 8 KiB a chunk, allocated as frames are met.
    static constexpr unsigned kChunkShift = 15;
    static constexpr uint64_t kChunkFrames = 1ull << kChunkShift;
    struct Chunk {
        std::atomic<uint64_t> known[kChunkFrames / 64] = {};
        std::atomic<uint64_t> shared[kChunkFrames / 64] = {};
    };
    Chunk& chunk(uint64_t frame);
    bool read(int kpagecount, int kpageflags, uint64_t first, uint64_t count);

    std::mutex mutex_;  // guards the map; a chunk's bits are atomic
    std::unordered_map<uint64_t, std::unique_ptr<Chunk>> chunks_;
};

// The verdicts of the gather in progress, shared by its workers; outside a gather, fresh ones
// for each caller. Gathers may overlap: the verdicts live until the last one ends, and a new
// gather starts afresh, since frames are freed and reused between gathers.
class RKFrameVerdictsOfGather {
public:
    void begin();
    void end();
    std::shared_ptr<RKFrameVerdicts> verdicts();

private:
    std::mutex mutex_;
    int gathers_ = 0;
    std::shared_ptr<RKFrameVerdicts> verdicts_;
};
