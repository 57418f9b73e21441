#pragma once

#include <atomic>
#include <string>
#include <thread>

struct sd_bus;

namespace rolvane {

// The daemon's own name on the session bus, net.rolvane.RolvaneManager: the bus starts the daemon for whoever asks for
// that name, and `systemctl --user service-log-level` reaches the log by it (interface org.freedesktop.LogControl1). A
// thread of its own answers, because a pass keeps the run loop from turning; it finds the bus again when it was lost.
// One object a process, made when the process has the right to serve its user.
class BusPresence {
public:
    static constexpr const char* kName = "net.rolvane.RolvaneManager";
    static constexpr const char* kLogPath = "/org/freedesktop/LogControl1";

    explicit BusPresence(std::string address);
    ~BusPresence();
    BusPresence(const BusPresence&) = delete;
    BusPresence& operator=(const BusPresence&) = delete;

private:
    void serve();
    bool waitFor(sd_bus* bus, int seconds) const; // false when the end has come

    const std::string _address;
    int _quit;
    std::thread _thread;
};

} // namespace rolvane
