#include "foundation/BusConnection.h"

#include "foundation/Url.h"

#include <cstdlib>

#include <sys/socket.h>
#include <unistd.h>

namespace rolvane {

namespace {

// Who serves the bus, as the kernel knows it; nobody where the bus is not reached by a socket of this machine.
bool isOfThisUserOrRoot(sd_bus* bus) {
    ucred peer{};
    socklen_t size = sizeof peer;
    const int fd = sd_bus_get_fd(bus);
    return fd >= 0 && ::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0 &&
           (peer.uid == ::geteuid() || peer.uid == 0);
}

using Steady = std::chrono::steady_clock;
constexpr int kMostSteps = 1000;

uint64_t microsecondsUntil(Steady::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::microseconds>(deadline - Steady::now()).count();
    return left > 0 ? static_cast<uint64_t>(left) : 0;
}

std::string value(const char* variable) {
    const char* text = std::getenv(variable);
    return text ? text : "";
}

} // namespace

std::optional<std::string> sessionBusAddress() {
    if (auto address = value("DBUS_SESSION_BUS_ADDRESS"); !address.empty()) return address;
    auto runtime = value("XDG_RUNTIME_DIR");
    if (runtime.empty() || runtime[0] != '/') return {};
    // Values of an address are escaped like those of a URL.
    return "unix:path=" + Url::percentEncodeComponent(runtime + "/bus");
}

Bus connectBus(const std::string& address, std::chrono::milliseconds limit) {
    auto deadline = Steady::now() + limit;
    sd_bus* made = nullptr;
    if (sd_bus_new(&made) < 0) return nullptr;
    Bus bus(made);
    if (sd_bus_set_address(made, address.c_str()) < 0 || sd_bus_set_bus_client(made, 1) < 0 || sd_bus_start(made) < 0)
        return nullptr;
    sd_bus_set_exit_on_disconnect(made, 0);
    if (!isOfThisUserOrRoot(made)) return nullptr;
    while (pumpBus(made)) {
        if (sd_bus_is_ready(made) > 0) return bus;
        uint64_t left = microsecondsUntil(deadline);
        if (left == 0) break;
        sd_bus_wait(made, left);
    }
    return nullptr;
}

bool pumpBus(sd_bus* bus) {
    for (int step = 0; step < kMostSteps; ++step) {
        int result = sd_bus_process(bus, nullptr);
        if (result < 0) return false;
        if (result == 0) break;
    }
    return sd_bus_is_open(bus) > 0;
}

bool drainBus(sd_bus* bus, std::chrono::milliseconds limit) {
    auto deadline = Steady::now() + limit;
    while (pumpBus(bus)) {
        uint64_t queued = 0;
        if (sd_bus_get_n_queued_write(bus, &queued) < 0) return false;
        if (queued == 0) return true;
        uint64_t left = microsecondsUntil(deadline);
        if (left == 0) return false;
        sd_bus_wait(bus, left);
    }
    return false;
}

} // namespace rolvane
