#pragma once

#include "foundation/RunLoop.h"

#include <atomic>
#include <functional>
#include <optional>

namespace rolvane {

// Feeds the service manager's watchdog while the daemon gets on: from the run loop, four times in each limit, and
// during a pass, which does not turn the loop, by the signs of life of its work. A daemon that is stuck gives no sign,
// and is killed and started anew by the manager. Made and destroyed on the loop's thread.
class Watchdog {
public:
    struct Collaborators {
        std::function<void()> feed;  // tells the manager; any thread
        std::function<double()> now; // seconds of a clock that never goes back
    };
    // The limit that the manager has set for this process, in seconds; none where nobody watches.
    static std::optional<double> limitOfTheManager();
    static Collaborators platform();

    Watchdog(RunLoop& loop, double limit, Collaborators with);
    Watchdog(const Watchdog&) = delete;
    Watchdog& operator=(const Watchdog&) = delete;

    void sign(); // any thread; feeds when a quarter of the limit has passed since the last time

private:
    void turn();

    RunLoop& _loop;
    const double _pause;
    const Collaborators _with;
    std::atomic<double> _fed;
    RunLoop::Handle _timer;
};

} // namespace rolvane
