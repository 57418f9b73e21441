#include "foundation/BootTime.h"

#include <ctime>

namespace rolvane {

double secondsSinceBoot() {
    constexpr double kNanosecond = 1e-9;
    timespec now{};
    ::clock_gettime(CLOCK_BOOTTIME, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * kNanosecond;
}

} // namespace rolvane
