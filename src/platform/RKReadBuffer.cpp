#include "platform/RKReadBuffer.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/RKUniqueFd.h"

namespace {

constexpr size_t kFirstCapacity = 256 << 10;

#if defined(__SANITIZE_THREAD__)
constexpr bool kThreadSanitizer = true;
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
constexpr bool kThreadSanitizer = true;
#else
constexpr bool kThreadSanitizer = false;
#endif
#else
constexpr bool kThreadSanitizer = false;
#endif

// ThreadSanitizer does not follow mremap: the moved pages keep the shadow of whatever was mapped
// at their new address before, often another worker's buffer, and it reports races that are not
// there. Under it the buffer grows by a new mapping and a copy, which it does follow.
void* moveToLarger(char* data, size_t capacity, size_t larger) {
    if (!kThreadSanitizer) return ::mremap(data, capacity, larger, MREMAP_MAYMOVE);
    void* fresh = ::mmap(nullptr, larger, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (fresh == MAP_FAILED) return MAP_FAILED;
    std::memcpy(fresh, data, capacity);
    ::munmap(data, capacity);
    return fresh;
}

}  // namespace

RKReadBuffer::~RKReadBuffer() {
    if (data_) ::munmap(data_, capacity_);
}

RKReadBuffer::RKReadBuffer(RKReadBuffer&& other) noexcept { swap(other); }

RKReadBuffer& RKReadBuffer::operator=(RKReadBuffer&& other) noexcept {
    RKReadBuffer gone(std::move(other));
    swap(gone);
    return *this;
}

void RKReadBuffer::swap(RKReadBuffer& other) noexcept {
    std::swap(data_, other.data_);
    std::swap(size_, other.size_);
    std::swap(capacity_, other.capacity_);
}

bool RKReadBuffer::grow() {
    if (!data_) {
        void* fresh = ::mmap(nullptr, kFirstCapacity, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (fresh == MAP_FAILED) return false;
        data_ = static_cast<char*>(fresh), capacity_ = kFirstCapacity;
        return true;
    }
    void* moved = moveToLarger(data_, capacity_, capacity_ * 2);
    if (moved == MAP_FAILED) return false;
    data_ = static_cast<char*>(moved), capacity_ *= 2;
    return true;
}

int RKReadBuffer::readAt(int dirfd, const char* name) {
    size_ = 0;
    RKUniqueFd fd(::openat(dirfd, name, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) return errno;
    for (;;) {
        if (size_ == capacity_ && !grow()) return ENOMEM;
        ssize_t n = ::read(fd.get(), data_ + size_, capacity_ - size_);
        if (n < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        if (n == 0) return 0;
        size_ += static_cast<size_t>(n);
    }
}
