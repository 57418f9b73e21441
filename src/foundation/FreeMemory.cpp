#include "foundation/FreeMemory.h"

#include <malloc.h>

namespace rolvane {

void shareHeaps() {
    mallopt(M_ARENA_MAX, 2);
}

void returnFreeMemory() {
    malloc_trim(0);
}

} // namespace rolvane
