#include "model/RKAssert.h"

#include <cstdio>
#include <cstdlib>

void RKAssertionFailure(const char* source, const char* text) {
    std::fprintf(stderr, "%s: assertion failed: %s\n", source, text);
    std::fflush(stderr);
    std::abort();
}
