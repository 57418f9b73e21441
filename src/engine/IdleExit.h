#pragma once

#include "foundation/RunLoop.h"

#include <functional>

namespace rolvane {

// The idle-exit interval and the idle-exit timer, one of each a process. Main thread.
class IdleExit {
public:
    static IdleExit& process(); // lives for the process

    static constexpr int kNever = -1;
    int interval() const { return _interval; } // seconds; kNever: the process stays
    void setInterval(int seconds) { _interval = seconds; }

    // Starts the countdown anew. With kNever nothing happens: a timer that is running goes on running.
    void arm(RunLoop& loop, std::function<void()> fire);
    void disarm();
    bool armed() const { return _timer != nullptr; } // or fired, and not armed again since

private:
    int _interval = kNever;
    RunLoop::Handle _timer;
};

} // namespace rolvane
