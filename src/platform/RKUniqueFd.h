// Owns a file descriptor and closes it once.
#pragma once

#include <unistd.h>

#include <utility>

class RKUniqueFd {
public:
    RKUniqueFd() = default;
    explicit RKUniqueFd(int fd) : fd_(fd) {}
    ~RKUniqueFd() { reset(); }
    RKUniqueFd(RKUniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    RKUniqueFd& operator=(RKUniqueFd&& other) noexcept {
        if (this != &other) {
            reset();
            fd_ = std::exchange(other.fd_, -1);
        }
        return *this;
    }
    RKUniqueFd(const RKUniqueFd&) = delete;
    RKUniqueFd& operator=(const RKUniqueFd&) = delete;

    int get() const { return fd_; }
    bool valid() const { return fd_ >= 0; }
    void reset(int fd = -1) {
        if (fd_ >= 0) ::close(fd_);
        fd_ = fd;
    }

private:
    int fd_ = -1;
};
