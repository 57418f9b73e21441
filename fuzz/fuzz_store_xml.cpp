#include "StoreXmlTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkStoreXml(data, size);
    return 0;
}
