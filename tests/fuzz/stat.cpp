// /proc/PID/stat text: the process list's record of a process.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "platform/RKProcStatParser.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    if (auto stat = RKParseProcStat(text)) RKBsdStatusForProcState(stat->state);
    RKIsElf32Header(text);
    RKLastPathComponent(RKExecutablePathFromLink(text, true));
    return 0;
}
