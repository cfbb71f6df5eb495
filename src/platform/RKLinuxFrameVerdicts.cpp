#include "platform/RKLinuxFrameVerdicts.h"

#include <vector>

#include "platform/RKLinuxPageReader.h"
#include "platform/RKPageDispositions.h"

namespace {

constexpr uint64_t kFramesPerRead = 4096;
// Frames this close to the last one wanted join its read: a read costs about as much as the
// kernel's work on a dozen frames.
constexpr uint64_t kJoinGap = 16;

}  // namespace

RKFrameVerdicts::Chunk& RKFrameVerdicts::chunk(uint64_t frame) {
    std::lock_guard lock(mutex_);
    std::unique_ptr<Chunk>& slot = chunks_[frame >> kChunkShift];
    if (!slot) slot = std::make_unique<Chunk>();
    return *slot;
}

bool RKFrameVerdicts::read(int kpagecount, int kpageflags, uint64_t first, uint64_t count) {
    std::vector<uint64_t> counts(count), flags(count);
    if (!RKPreadAll(kpagecount, counts.data(), count * 8, first * 8) ||
        !RKPreadAll(kpageflags, flags.data(), count * 8, first * 8))
        return false;
    // Bits gathered a word at a time, then published with one atomic or each.
    Chunk* current = nullptr;
    uint64_t chunkIndex = UINT64_MAX;
    for (uint64_t at = 0; at < count;) {
        const uint64_t frame = first + at;
        if (frame >> kChunkShift != chunkIndex) {
            chunkIndex = frame >> kChunkShift;
            current = &chunk(frame);
        }
        const uint64_t word = (frame & (kChunkFrames - 1)) / 64;
        uint64_t known = 0, shared = 0;
        for (; at < count && (first + at) / 64 == frame / 64; at++) {
            const uint64_t bit = 1ull << ((first + at) % 64);
            known |= bit;
            if (counts[at] > 1 && !(flags[at] & RKKpfZeroPage)) shared |= bit;
        }
        current->shared[word].fetch_or(shared, std::memory_order_relaxed);
        current->known[word].fetch_or(known, std::memory_order_release);
    }
    return true;
}

bool RKFrameVerdicts::shared(int kpagecount, int kpageflags, std::span<const uint64_t> frames,
                             std::span<uint8_t> shared) {
    bool complete = true;
    Chunk* current = nullptr;
    uint64_t chunkIndex = UINT64_MAX;
    auto look = [&](uint64_t frame, uint8_t& verdict) {
        if (frame >> kChunkShift != chunkIndex) {
            chunkIndex = frame >> kChunkShift;
            current = &chunk(frame);
        }
        const uint64_t word = (frame & (kChunkFrames - 1)) / 64, bit = 1ull << (frame % 64);
        if (!(current->known[word].load(std::memory_order_acquire) & bit)) return false;
        verdict = (current->shared[word].load(std::memory_order_relaxed) & bit) != 0;
        return true;
    };
    for (size_t i = 0; i < frames.size();) {
        shared[i] = 0;
        if (look(frames[i], shared[i])) {
            i++;
            continue;
        }
        // A run of unknown frames, read whole, then answered from what was kept.
        const uint64_t first = frames[i];
        uint64_t last = first;
        size_t j = i + 1;
        for (uint8_t ignored; j < frames.size() && frames[j] < first + kFramesPerRead && frames[j] <= last + kJoinGap; j++)
            if (!look(frames[j], ignored)) last = frames[j];
        const bool read = this->read(kpagecount, kpageflags, first, last - first + 1);
        complete = complete && read;
        for (; i < j; i++)
            if (!look(frames[i], shared[i])) shared[i] = 0;
    }
    return complete;
}

void RKFrameVerdictsOfGather::begin() {
    std::lock_guard lock(mutex_);
    if (gathers_++ == 0) verdicts_ = std::make_shared<RKFrameVerdicts>();
}

void RKFrameVerdictsOfGather::end() {
    std::lock_guard lock(mutex_);
    if (gathers_ > 0 && --gathers_ == 0) verdicts_.reset();
}

std::shared_ptr<RKFrameVerdicts> RKFrameVerdictsOfGather::verdicts() {
    std::lock_guard lock(mutex_);
    return verdicts_ ? verdicts_ : std::make_shared<RKFrameVerdicts>();
}
