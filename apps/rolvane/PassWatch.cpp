#include "PassWatch.h"

#include <algorithm>
#include <chrono>

namespace rolvane::cli {

PassWatch::PassWatch(Context& context, bool progress) : _context(context) {
    using Kind = Event::Kind;
    DistributedNotifications& bus = context.bus();
    _observations.push_back(bus.observe(
        "CXDStartedSyncingNotification",
        [this](const Notification&) {
            heard({Kind::started, {}, 0});
        },
        false));
    if (progress)
        _observations.push_back(bus.observe(
            "CXDSyncProgressNotification",
            [this](const Notification& n) {
                heard({Kind::progress, n.userInfo["remoteLocation"].string(), n.userInfo["progress"].real()});
            },
            false));
    _observations.push_back(bus.observe(
        "CXDStoppedSyncingNotification",
        [this](const Notification&) {
            heard({Kind::stopped, {}, 0});
        },
        false));
}

void PassWatch::heard(const Event& event) {
    if (event.kind == Event::Kind::started) ++_started;
    if (event.kind == Event::Kind::stopped) ++_stopped;
    // Progress comes thousands of times a second, and the test is not for free.
    if (event.kind != Event::Kind::progress) _news = true;
    if (onEvent) onEvent(event);
}

bool PassWatch::waitUntil(const std::function<bool()>& test, double seconds) {
    using Clock = std::chrono::steady_clock;
    constexpr double kAskAgain = 0.5;
    const auto end = Clock::now() + std::chrono::duration<double>(seconds);
    auto asked = Clock::now();
    while (!test()) {
        _news = false;
        asked = Clock::now();
        while (!_news && Clock::now() - asked < std::chrono::duration<double>(kAskAgain) && Clock::now() < end)
            _context.loop().runOnce(std::min(kAskAgain, std::chrono::duration<double>(end - Clock::now()).count()));
        if (Clock::now() >= end) return test();
    }
    return true;
}

} // namespace rolvane::cli
