#include "platform/RKProcFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "platform/RKUniqueFd.h"

int RKReadFileAt(int dirfd, const char* name, std::string& buffer) {
    buffer.clear();
    RKUniqueFd fd(::openat(dirfd, name, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) return errno;
    if (buffer.capacity() < 4096) buffer.reserve(4096);
    size_t used = 0;
    for (;;) {
        if (used == buffer.capacity()) buffer.reserve(buffer.capacity() * 2);
        buffer.resize(buffer.capacity());
        ssize_t n = ::read(fd.get(), buffer.data() + used, buffer.size() - used);
        if (n < 0) {
            if (errno == EINTR) continue;
            int error = errno;
            buffer.resize(used);
            return error;
        }
        if (n == 0) break;
        used += static_cast<size_t>(n);
    }
    buffer.resize(used);
    return 0;
}
