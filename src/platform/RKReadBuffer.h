// A buffer for a file read whole whose size is not known beforehand (a process's smaps: a few
// hundred KB, or tens of MB for a process with tens of thousands of mappings). It is memory
// mapped and grows with mremap: pages move rather than being copied, the old and new buffers
// are never alive together, and only the pages that were written count as resident.
#pragma once

#include <cstddef>
#include <string_view>

class RKReadBuffer {
public:
    RKReadBuffer() = default;
    ~RKReadBuffer();
    RKReadBuffer(RKReadBuffer&& other) noexcept;
    RKReadBuffer& operator=(RKReadBuffer&& other) noexcept;
    RKReadBuffer(const RKReadBuffer&) = delete;
    RKReadBuffer& operator=(const RKReadBuffer&) = delete;

    // Reads `name` under `dirfd` whole, replacing what was held: 0, or the errno.
    int readAt(int dirfd, const char* name);
    std::string_view view() const { return {data_, size_}; }
    bool empty() const { return size_ == 0; }
    size_t capacity() const { return capacity_; }
    void swap(RKReadBuffer& other) noexcept;

private:
    bool grow();

    char* data_ = nullptr;
    size_t size_ = 0;
    size_t capacity_ = 0;
};
