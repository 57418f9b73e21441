#include "AclBodyTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkAclBody(data, size);
    return 0;
}
