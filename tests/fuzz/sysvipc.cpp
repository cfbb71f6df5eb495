// /proc/sysvipc/shm text: the system's SysV shared memory segments.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/RKOwnedObjectParsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    RKParseSysVShm(std::string_view(reinterpret_cast<const char*>(data), size));
    return 0;
}
