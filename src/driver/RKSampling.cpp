#include "driver/RKSampling.h"

#include <cstdio>

// NOT YET BUILT: sampling mode comes in a later change. Until then --sample is refused honestly
// instead of pretending to sample.
int RKRunSampling(RKMemspreadArgs&, RKOutputFormatterList&) {
    std::fprintf(stderr, "memspread: --sample is not available yet\n");
    return 1;
}
