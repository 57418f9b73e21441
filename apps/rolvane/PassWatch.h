#pragma once

#include "Context.h"
#include "foundation/Notification.h"

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <sys/types.h>

namespace rolvane::cli {

// Notices a daemon that runs and answers nobody: one that was stopped, or hangs. A daemon that is busy answers.
class DaemonPulse {
public:
    static constexpr double kAnswerSeconds = 4;

    explicit DaemonPulse(Context& context) : _context(context) {}
    // Asks now and then, and returns at once. Throws CommandError when an answer is overdue.
    void check();

private:
    bool answered();
    Context& _context;
    std::optional<pid_t> _process;
    std::optional<int64_t> _number; // of the question that is under way
    std::optional<std::chrono::steady_clock::time_point> _since, _answered;
};

// Hears what the daemon says of its passes, from construction on.
class PassWatch {
public:
    // Without progress, which is a notification a contact, the bus and this process have nothing to do for it.
    explicit PassWatch(Context& context, bool progress = true);

    // What came: one of the three notifications, with location and fraction for progress.
    struct Event {
        enum class Kind { started, progress, stopped } kind;
        std::string location;
        double fraction = 0;
    };
    std::function<void(const Event&)> onEvent; // on this thread, while it waits

    // Waits until the test holds: it is asked at once, when a pass has started or stopped, and twice a second, as an
    // event may have been missed. False when the time ran out. Throws CommandError for a daemon that does not answer.
    bool waitUntil(const std::function<bool()>& test, double seconds);
    // Posts it, and returns when the daemon has heard: true when it acts on such a notification, false when it serves
    // nothing. None when no daemon runs. Throws CommandError for a daemon that does not answer.
    std::optional<bool> tell(const std::string& name);
    // As far as was heard, a pass is under way.
    bool atWork() const { return _atWork; }

    int started() const { return _started; }
    int stopped() const { return _stopped; }

private:
    void heard(const Event& event);
    Context& _context;
    std::vector<ObservationHandle> _observations;
    int _started = 0, _stopped = 0;
    bool _news = false, _atWork = false;
};

} // namespace rolvane::cli
