#include "AnswerHeadTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkAnswerHead(data, size);
    return 0;
}
