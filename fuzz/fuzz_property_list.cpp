#include "PropertyListTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkPropertyList(data, size);
    return 0;
}
