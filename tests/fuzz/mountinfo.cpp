// /proc/PID/mountinfo text: the target's mount table.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/RKMountInfoParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    RKParseMountInfo(std::string_view(reinterpret_cast<const char*>(data), size));
    return 0;
}
