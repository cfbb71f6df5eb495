// /proc/PID/status text: the per-process memory figures.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/RKProcStatusFigures.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    RKParseStatusFigures(std::string_view(reinterpret_cast<const char*>(data), size));
    return 0;
}
