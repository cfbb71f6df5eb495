// Hands the heap's free pages back to the system. Worker threads allocate from arenas of their
// own: what a worker allocated and the main thread freed (a gather's page records) stays
// resident in that arena, out of the main thread's reach, unless it is returned.
#pragma once

void RKReturnFreedHeap();
