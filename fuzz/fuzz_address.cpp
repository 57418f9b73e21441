#include "AddressTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkAddress(data, size);
    return 0;
}
