#include "PassWatch.h"
#include "Texts.h"

#include "daemon/DaemonControl.h"

#include <algorithm>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Steady = std::chrono::steady_clock;

double secondsSince(Steady::time_point then) {
    return std::chrono::duration<double>(Steady::now() - then).count();
}

} // namespace

// The question that is under way has its answer.
bool DaemonPulse::answered() {
    return _number && _context.bus().socket().heard(*_number);
}

void DaemonPulse::check() {
    constexpr double kAskAgain = 1;
    const auto process = DaemonControl().running();
    if (!process || process != _process) {
        _process = process;
        _number.reset();
        _since.reset();
        _answered.reset();
    }
    if (!process) return;
    if (answered()) {
        _number.reset();
        _since.reset();
        _answered = Steady::now();
    }
    if (!_since && _answered && secondsSince(*_answered) < kAskAgain) return;
    if (!_since) _since = Steady::now();
    ControlClient& socket = _context.bus().socket();
    if (!socket.connected()) _number.reset(); // what was asked before went to a connection that has ended
    if (!_number) _number = socket.ask();
    if (secondsSince(*_since) < kAnswerSeconds) return;
    _context.loop().runOnce(0); // the answer may lie there: it was this process that rested
    if (answered()) return;
    throw CommandError(kUnreachable, tr("RolvaneManager (process {}) runs, but does not answer: it was "
                                        "stopped, or hangs. `rolvane daemon restart` ends it and starts it "
                                        "anew; nothing that was saved is lost.",
                                        *process));
}

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
    _atWork = event.kind != Event::Kind::stopped;
    // Progress comes thousands of times a second, and the test is not for free.
    if (event.kind != Event::Kind::progress) _news = true;
    if (onEvent) onEvent(event);
}

bool PassWatch::waitUntil(const std::function<bool()>& test, double seconds) {
    constexpr double kAskAgain = 0.5;
    const auto start = Steady::now();
    DaemonPulse pulse(_context);
    while (!test()) {
        pulse.check();
        _news = false;
        const auto asked = Steady::now();
        while (!_news && secondsSince(asked) < kAskAgain && secondsSince(start) < seconds)
            _context.loop().runOnce(std::clamp(seconds - secondsSince(start), 0.0, kAskAgain));
        if (secondsSince(start) >= seconds) return test();
    }
    return true;
}

std::optional<bool> PassWatch::tell(const std::string& name) {
    constexpr double kAskAgain = 0.05;
    const DaemonControl daemon;
    const Notification notification{name, std::nullopt, {}};
    DaemonPulse pulse(_context);
    ControlClient& socket = _context.bus().socket();
    std::optional<int64_t> number;
    while (daemon.running()) {
        if (!socket.connected()) number.reset();
        if (!number) number = _context.bus().postForAnswer(notification);
        if (const auto acts = number ? socket.heard(*number) : std::nullopt) return acts;
        pulse.check();
        _context.loop().runOnce(kAskAgain);
    }
    return std::nullopt;
}

} // namespace rolvane::cli
