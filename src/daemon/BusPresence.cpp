#include "daemon/BusPresence.h"

#include "daemon/LogControl.h"
#include "foundation/BusConnection.h"

#include <cstdint>
#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

namespace rolvane {

namespace {

using namespace std::chrono_literals;

constexpr auto kConnectLimit = 2s;
constexpr int kSearchAgain = 5; // seconds between attempts to find a bus

} // namespace

BusPresence::BusPresence(std::string address)
    : _address(std::move(address)), _quit(::eventfd(0, EFD_CLOEXEC)), _thread([this] { serve(); }) {}

BusPresence::~BusPresence() {
    const uint64_t one = 1;
    [[maybe_unused]] const ssize_t n = ::write(_quit, &one, sizeof one);
    _thread.join();
    ::close(_quit);
}

// A name that somebody else has is waited for: the bus gives it on when its owner ends.
void BusPresence::serve() {
    for (;;) {
        const Bus bus = connectBus(_address, kConnectLimit);
        const LogControl control(bus.get(), kLogPath);
        const bool named = bus && sd_bus_request_name(bus.get(), kName, SD_BUS_NAME_QUEUE) >= 0;
        while (named && pumpBus(bus.get()))
            if (!waitFor(bus.get(), -1)) return;
        if (!waitFor(nullptr, kSearchAgain)) return;
    }
}

bool BusPresence::waitFor(sd_bus* bus, int seconds) const {
    constexpr int kMilliseconds = 1000;
    pollfd fds[2] = {{_quit, POLLIN, 0}, {-1, 0, 0}};
    int limit = seconds < 0 ? -1 : seconds * kMilliseconds;
    if (bus) {
        fds[1] = {sd_bus_get_fd(bus), static_cast<short>(sd_bus_get_events(bus)), 0};
        uint64_t until = UINT64_MAX; // of the library's own calls that wait for an answer
        if (sd_bus_get_timeout(bus, &until) > 0 && until != UINT64_MAX) limit = kMilliseconds;
    }
    ::poll(fds, 2, limit);
    return fds[0].revents == 0;
}

} // namespace rolvane
