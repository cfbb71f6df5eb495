// /proc/PID/fdinfo/N text of a dma-buf descriptor.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/RKOwnedObjectParsers.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    RKParseDmaBufFdinfo(std::string_view(reinterpret_cast<const char*>(data), size));
    return 0;
}
