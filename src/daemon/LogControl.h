#pragma once

#include <memory>
#include <string>

struct sd_bus;
struct sd_bus_slot;

namespace rolvane {

// The interface org.freedesktop.LogControl1 of this process's log, at a path of a bus connection: the level "debug"
// stands for a debug level of 1, "notice" for 0, and the targets are "journal", "console" and "auto". A change lasts as
// long as the process; the preference CXDDebugLevel is not written. Any program of the user may ask for it. Serves
// while the object lives; without a connection nothing happens.
class LogControl {
public:
    LogControl(sd_bus* bus, const char* path);

private:
    struct SlotCloser {
        void operator()(sd_bus_slot* slot) const;
    };
    std::unique_ptr<sd_bus_slot, SlotCloser> _slot;
};

// The debug level that a syslog level's name stands for; -1 for no such name. `present` stays where it says as much.
int debugLevelOfName(const std::string& name, int present);

} // namespace rolvane
