#include "output/RKTextRegionListing.h"

#include <cinttypes>

#include "model/RKEscapedText.h"
#include "model/RKMemoryRegion.h"
#include "output/RKTextNames.h"
#include "output/RKTextSettings.h"
#include "output/RKTextSizeFormat.h"

namespace {

// Object ids are shown in their low 40 bits, the width of the column.
constexpr uint64_t kObjectIdMask = (uint64_t{1} << 40) - 1;

struct Columns {
    bool swapped;
    bool wired;
    bool wide;
};

void printHeader(FILE* output, const Columns& columns) {
    std::fprintf(output,
                 "           start                end  [objectid]      VRT     DRT%*s     CLN     RCL%*s   tag "
                 "(detail)\n",
                 columns.swapped ? 8 : 0, columns.swapped ? "     SWP" : "", columns.wired ? 8 : 0,
                 columns.wired ? "    WIRE" : "");
    std::fprintf(output,
                 "      ----------         ----------  ----------    -----   -----%*s   -----   -----%*s   "
                 "------------\n",
                 columns.swapped ? 8 : 0, columns.swapped ? "   -----" : "", columns.wired ? 8 : 0,
                 columns.wired ? "   -----" : "");
}

void printRegion(FILE* output, const RKMemoryRegion& region, uint64_t pageSize, const Columns& columns) {
    const uint64_t objectId = region.object_id & kObjectIdMask;
    if (region.start == RKRegionNoAddress) {
        std::fprintf(output, "        unmapped -         unmapped [%10" PRIx64 "]", objectId);
    } else {
        std::fprintf(output, "%16" PRIx64 " - %16" PRIx64 " [%10" PRIx64 "]", region.start, region.start + region.size,
                     objectId);
    }
    auto pages = [pageSize](uint64_t bytes) { return RKTextPagesForBytes(bytes, pageSize); };
    std::fprintf(output, " %7" PRIu64 " %7" PRIu64, pages(region.size), pages(region.dirtySize + region.swappedSize));
    if (columns.swapped) std::fprintf(output, " %7" PRIu64, pages(region.swappedSize));
    std::fprintf(output, " %7" PRIu64 " %7" PRIu64, pages(region.cleanNonSpecSize), pages(region.reclaimableSize));
    if (columns.wired) std::fprintf(output, " %7" PRIu64, pages(region.wiredSize()));

    const std::string detail = RKEscapedText(RKTextTruncatedName(region.detailedName, columns.wide));
    std::fprintf(output, "   %s%s%s\n", RKEscapedText(region.name).c_str(), detail.empty() ? "" : " ", detail.c_str());
}

}  // namespace

void RKTextPrintRegionListing(FILE* output, const RKProcess& process, const RKRegionList& regions, int64_t options) {
    const Columns columns{(options & RKTextOptionSwapped) != 0, (options & RKTextOptionWired) != 0,
                          (options & RKTextOptionWide) != 0};
    std::fprintf(output, "%s\n\n", RKEscapedText(process.displayString()).c_str());
    printHeader(output, columns);
    for (const auto& region : regions) {
        if (region) printRegion(output, *region, process.pageSize(), columns);
    }
    std::fputs("\n", output);
}
