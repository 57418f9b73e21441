#include "AccessListsTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkAccessLists(data, size);
    return 0;
}
