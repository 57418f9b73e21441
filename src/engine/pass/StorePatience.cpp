#include "engine/pass/StorePatience.h"

#include "store/dav/CXDAVManager.h"

#include <algorithm>

namespace rolvane {
namespace {

// Seconds from the first attempt on.
double patienceWith(const PassFailure& failure) {
    constexpr int kBusy[] = {408, 429, 502, 503, 504};
    if (std::find(std::begin(kBusy), std::end(kBusy), failure.status) != std::end(kBusy))
        return StorePatience::kForBusy;
    if (failure.status != 0) return 0;
    if (failure.error == kCXDAVErrorTimedOut) return StorePatience::kForBusy;
    const bool isNameUnknown = failure.words.find("resolve") != std::string::npos;
    return failure.error == kCXDAVErrorCannotConnect && !isNameUnknown ? StorePatience::kForAbsent : 0;
}

} // namespace

std::optional<double> StorePatience::pauseAfter(const PassFailure& failure, double spent, double random) {
    const double asked = failure.retryAfterSeconds.value_or(0);
    const double pause = std::max(_pause * (0.5 + random), asked * (1 + random / 4));
    if (spent + pause > patienceWith(failure)) return std::nullopt;
    _pause = std::min(2 * _pause, kLongestPause);
    return pause;
}

} // namespace rolvane
