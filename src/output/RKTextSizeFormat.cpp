#include "output/RKTextSizeFormat.h"

#include <bsd/libutil.h>

#include <cinttypes>
#include <cstdio>
#include <limits>

#include "output/RKTextSettings.h"

namespace {

std::string humanized(int64_t bytes) {
    // humanize_number negates a negative count before scaling, which overflows for the most
    // negative one alone; that count is exactly -8 EB.
    if (bytes == std::numeric_limits<int64_t>::min()) return "-8 EB";
    char buffer[8];  // the seven characters of the widest result and the terminator
    if (humanize_number(buffer, sizeof buffer, bytes, "B", HN_AUTOSCALE, 0) < 0) return "?";
    return buffer;
}

}  // namespace

uint64_t RKTextPagesForBytes(uint64_t bytes, uint64_t pageSize) {
    if (pageSize == 0) return 0;
    return bytes / pageSize + (bytes % pageSize != 0 ? 1 : 0);
}

std::string RKTextFormattedSize(int64_t bytes, int64_t summaryFormat, uint64_t pageSize) {
    char buffer[32];
    switch (summaryFormat) {
    case RKSummaryFormatBytes:
        std::snprintf(buffer, sizeof buffer, "%" PRId64 " B", bytes);
        return buffer;
    case RKSummaryFormatPages:
        std::snprintf(buffer, sizeof buffer, "%" PRIu64 " pages",
                      RKTextPagesForBytes(static_cast<uint64_t>(bytes), pageSize));
        return buffer;
    default:
        return humanized(bytes);
    }
}
