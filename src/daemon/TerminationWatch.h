#pragma once

#include <functional>
#include <thread>

namespace rolvane {

// Turns SIGTERM, SIGINT and SIGHUP into a call on a thread of its own, so that a pass that keeps the main thread busy
// hears of them too. When the process has not ended by itself `graceSeconds` later it is ended with status 0: every
// state that matters is durable at any moment. Construct it before any other thread is started: the signals are blocked
// for the thread that constructs it and all that it starts.
class TerminationWatch {
public:
    TerminationWatch(std::function<void()> terminate, double graceSeconds);
    ~TerminationWatch();
    TerminationWatch(const TerminationWatch&) = delete;
    TerminationWatch& operator=(const TerminationWatch&) = delete;

private:
    void serve(const std::function<void()>& terminate, double graceSeconds);
    int _signals = -1, _quit = -1;
    std::thread _thread;
};

} // namespace rolvane
