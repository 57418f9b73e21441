#include "ReportBodyTarget.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    rolvane::fuzz::checkReportBody(data, size);
    return 0;
}
