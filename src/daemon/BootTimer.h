#pragma once

#include "foundation/RunLoop.h"

#include <functional>
#include <optional>

namespace rolvane {

// One timer that also runs while the machine sleeps: what was due meanwhile fires when it wakes. On the loop's thread.
class BootTimer {
public:
    BootTimer(RunLoop& loop, std::function<void()> fire);
    ~BootTimer();
    BootTimer(const BootTimer&) = delete;
    BootTimer& operator=(const BootTimer&) = delete;

    void set(std::optional<double> secondsSinceBoot); // none: not at all; what has passed fires at the next turn

private:
    const std::function<void()> _fire;
    int _fd;
    RunLoop::Handle _port;
};

// Calls back when the machine wakes from a sleep of some seconds. On the loop's thread.
class SleepWatch {
public:
    // Seconds that the machine has slept since it was started. Exists so that tests can replace it.
    using Slept = std::function<double()>;
    static double secondsSlept();

    SleepWatch(RunLoop& loop, std::function<void()> woken, Slept slept = secondsSlept);
    ~SleepWatch();
    SleepWatch(const SleepWatch&) = delete;
    SleepWatch& operator=(const SleepWatch&) = delete;

    void clockJumped(); // what the kernel tells when it wakes, and when somebody sets the clock

private:
    void arm() const;
    const std::function<void()> _woken;
    const Slept _slept;
    double _before;
    int _fd;
    RunLoop::Handle _port;
};

} // namespace rolvane
