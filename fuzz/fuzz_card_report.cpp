#include "CardReportTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkCardReport(data, size);
    return 0;
}
