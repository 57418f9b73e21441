#include "daemon/Watchdog.h"

#include "foundation/BootTime.h"

#include <systemd/sd-daemon.h>

namespace rolvane {

namespace {

constexpr double kFeedsInALimit = 4;
constexpr double kMicroseconds = 1e6;

} // namespace

std::optional<double> Watchdog::limitOfTheManager() {
    uint64_t microseconds = 0;
    if (sd_watchdog_enabled(0, &microseconds) <= 0) return std::nullopt;
    return static_cast<double>(microseconds) / kMicroseconds;
}

Watchdog::Collaborators Watchdog::platform() {
    return {[] { sd_notify(0, "WATCHDOG=1"); }, secondsSinceBoot};
}

Watchdog::Watchdog(RunLoop& loop, double limit, Collaborators with)
    : _loop(loop), _pause(limit / kFeedsInALimit), _with(std::move(with)), _fed(_with.now()) {
    _with.feed();
    _timer = _loop.scheduleTimer(_pause, [this] { turn(); });
}

void Watchdog::turn() {
    sign();
    _timer = _loop.scheduleTimer(_pause, [this] { turn(); });
}

void Watchdog::sign() {
    const double now = _with.now();
    double fed = _fed.load();
    if (now - fed < _pause) return;
    if (_fed.compare_exchange_strong(fed, now)) _with.feed(); // another thread has fed otherwise
}

} // namespace rolvane
