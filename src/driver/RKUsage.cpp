#include <string>

#include "driver/RKMemspreadArgs.h"

namespace {

// Lines only internal builds of the platform list. Linux has no internal builds, so --metrilog
// works but stays out of the usage.
constexpr bool kInternalBuild = false;

}  // namespace

void printUsage(FILE* out) {
    std::fputs("Gather memory information about a process or set of processes\n"
               "Usage: memspread [args] [proc/pid/vmsnap [proc/pid/vmsnap [...]]]\n"
               "    -a, --all                             target all processes\n"
               "    -j, --json <file>                     print json output to a file\n"
               "    -h, --help                            print this output\n"
               "    -p, --proc, --pid [proc/pid]          target pid or process (or interpret for -p)\n"
               "    -x, --exclude [proc/pid]              exclude pid or process\n"
               "    -s, --skip                            skip processes that are idle-exit clean\n"
               "    -v                                    print all regions and spanlist-like output "
               "of address space layout (default output is a summary)\n"
               "    -f, --format (bytes|formatted|pages)  change size formatting preference "
               "(default: formatted)\n",
               out);
    std::string defaultSort = RKTextSortColumnArgument(RKTextSortColumns.front());
    std::fprintf(out, "    --sort <column>                       change the column used for sorting (default: %s)\n",
                 defaultSort.c_str());
    std::fputs("    -w, --wide                            show wide output with all columns and full paths "
               "(implies --swapped --wired)\n"
               "    --swapped                             show swapped/compressed column\n"
               "    --wired                               show wired column\n"
               "    --vmObjectDirty                       interpret dirty memory as viewed by VM objects "
               "in the kernel\n"
               "    --unmapped                            search all processes for unmapped memory owned "
               "by the target processes\n"
               "    --sample <interval>                    repeatedly gather memspread at the given sampling "
               "interval in seconds (can be fractional \u2014 e.g. 0.5)\n",
               out);
    if (kInternalBuild) {
        std::fputs("\n"
                   "NordaInternal:\n"
                   "    --metrilog <file.mlj>                 print metrilog(1) output to a file\n",
                   out);
    }
}
