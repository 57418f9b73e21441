#include "foundation/FreeMemory.h"

#include <malloc.h>

namespace rolvane {

void shareHeaps() {
    mallopt(M_ARENA_MAX, 2);
    // What is freed at the end of a heap is wanted again at once while a pass runs; returnFreeMemory gives it back.
    mallopt(M_TRIM_THRESHOLD, 8 << 20);
    mallopt(M_TOP_PAD, 1 << 20);
}

void returnFreeMemory() {
    malloc_trim(0);
}

} // namespace rolvane
