#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>

#include <systemd/sd-bus.h>

namespace rolvane {

struct BusCloser {
    void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
};
using Bus = std::unique_ptr<sd_bus, BusCloser>;

// The address of the environment's session bus; none when it names none.
std::optional<std::string> sessionBusAddress();

// A connection that is ready for messages; none when there is no bus at the address, it does not answer in time, or its
// program is somebody else's than this user's or root's: on the bus of another user (one whose environment was
// inherited) that user would hear what is said there, and could speak. Does not end the process when the bus goes away.
Bus connectBus(const std::string& address, std::chrono::milliseconds limit);

// Reads and writes what is possible without waiting. False when the bus is gone.
bool pumpBus(sd_bus* bus);

// Writes out what is queued, waiting at most so long. True when nothing is queued any more; false also when the bus is
// gone (then `pumpBus` says so).
bool drainBus(sd_bus* bus, std::chrono::milliseconds limit);

} // namespace rolvane
