#include "platform/RKFreedHeap.h"

#include <malloc.h>

void RKReturnFreedHeap() { malloc_trim(0); }
