#include "driver/RKMain.h"

#include <cstdio>

int RKMain(int, char**) {
    std::fprintf(stderr, "memspread: not built yet\n");
    return 1;
}
