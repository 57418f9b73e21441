#include "KeyedArchiveTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkKeyedArchive(data, size);
    return 0;
}
