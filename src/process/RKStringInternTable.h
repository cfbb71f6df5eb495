// Process-wide tables that make equal strings one shared object across all processes gathered
// at once (image paths and segment names repeat in every process). Slots go from empty to
// filled exactly once by compare-and-swap and are never freed or replaced, so readers need no
// lock and a string handed out stays valid for the life of the program.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

using RKSharedString = std::shared_ptr<const std::string>;

// A string the caller owns alone.
RKSharedString RKUnsharedString(std::string_view text);

template <size_t Slots>
class RKStringInternTable {
public:
    RKStringInternTable() = default;
    // The process-wide tables live until exit, when nothing gathers any more.
    ~RKStringInternTable() {
        for (auto& slot : slots_) delete slot.load(std::memory_order_acquire);
    }
    RKStringInternTable(const RKStringInternTable&) = delete;
    RKStringInternTable& operator=(const RKStringInternTable&) = delete;

    // The interned string equal to `text` (compared on its first `limit` bytes), probing at most
    // `probes` slots from `first` onwards (wrapping); a new unshared string when all of them
    // hold other strings.
    RKSharedString intern(std::string_view text, size_t first, size_t probes, size_t limit) {
        const std::string_view key = text.substr(0, limit);
        for (size_t i = 0; i < probes && i < Slots; i++) {
            std::atomic<const std::string*>& slot = slots_[(first + i) % Slots];
            const std::string* held = slot.load(std::memory_order_acquire);
            if (!held) {
                auto fresh = std::make_unique<const std::string>(text);
                if (slot.compare_exchange_strong(held, fresh.get(), std::memory_order_release,
                                                 std::memory_order_acquire))
                    return borrowed(fresh.release());
                // Another thread filled the slot first: `held` is its string.
            }
            if (std::string_view(*held).substr(0, limit) == key) return borrowed(held);
        }
        return RKUnsharedString(text);
    }

    // How many slots are filled (for tests).
    size_t filledCount() const {
        size_t count = 0;
        for (const auto& slot : slots_) count += slot.load(std::memory_order_acquire) != nullptr;
        return count;
    }

private:
    // Interned strings live as long as the program: the pointer owns nothing.
    static RKSharedString borrowed(const std::string* string) { return RKSharedString(RKSharedString(), string); }

    std::atomic<const std::string*> slots_[Slots] = {};
};

// Owner paths of images inside the shared region, hashed by load address.
inline constexpr size_t RKPathInternSlots = 2047;
inline constexpr size_t RKPathInternProbes = 18;
inline constexpr size_t RKPathInternLimit = 1024;
// Segment names, scanned linearly.
inline constexpr size_t RKSegmentNameInternSlots = 16;
inline constexpr size_t RKSegmentNameInternLimit = 32;

RKStringInternTable<RKPathInternSlots>& pathInternCache();
RKStringInternTable<RKSegmentNameInternSlots>& segmentNameInternCache();

// The first slot of a shared-region image's path: its load address folded onto itself.
size_t RKPathInternSlotForBase(uint64_t baseAddress);
