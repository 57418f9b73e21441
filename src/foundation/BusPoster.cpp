#include "foundation/BusPoster.h"

#include "foundation/DeliveryQueue.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/NotificationMessage.h"

#include <cstring>

#include <sys/eventfd.h>
#include <unistd.h>

namespace rolvane {

namespace {

using namespace std::chrono_literals;
using Steady = std::chrono::steady_clock;

constexpr auto kConnectLimit = 500ms;
constexpr auto kPumpInterval = 20ms;
constexpr auto kSlowBusLimit = 100ms;
constexpr auto kFarewellLimit = 500ms;
// After a failed attempt so many times its duration pass before the next one: looking for a bus that is not there costs
// microseconds and is done often, waiting for one that hangs costs half a second and is done seldom.
constexpr int kRestFactor = 10;

} // namespace

BusPoster::BusPoster(std::optional<std::string> address)
    : _address(std::move(address)), _queuedDescriptor(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    connect();
}

BusPoster::~BusPoster() {
    if (_bus) drainBus(_bus.get(), kFarewellLimit);
    _bus.reset();
    if (_queuedDescriptor >= 0) ::close(_queuedDescriptor);
}

bool BusPoster::connect() {
    auto start = Steady::now();
    if (!_address || start < _nextAttempt) return false;
    _bus = connectBus(*_address, kConnectLimit);
    _stalled = false;
    if (!_bus) _nextAttempt = Steady::now() + (Steady::now() - start) * kRestFactor;
    return _bus != nullptr;
}

// Whether there is a connection whose other end is still there; notices the end of one that went away.
bool BusPoster::pump() {
    if (_bus && !pumpBus(_bus.get())) _bus.reset();
    return _bus != nullptr;
}

// The same for somebody who is about to send, which notices, too: hardly anything comes in, so it is not looked for at
// each of thousands of notifications a second.
bool BusPoster::ready() {
    const auto now = Steady::now();
    if (_bus && now < _nextPump) return true;
    _nextPump = now + kPumpInterval;
    return pump();
}

int BusPoster::send(const Notification& notification) {
    uint64_t queued = 0;
    sd_bus_get_n_queued_write(_bus.get(), &queued);
    if (queued >= kMostQueued) return -ENOBUFS;
    BusMessage message;
    int result = makeNotificationMessage(_bus.get(), notification, message);
    return result < 0 ? result : sd_bus_send(_bus.get(), message.get(), nullptr);
}

void BusPoster::watchQueue() {
    uint64_t queued = 0;
    if (sd_bus_get_n_queued_write(_bus.get(), &queued) < 0) return;
    if (queued == 0) {
        _stalled = false;
    } else if (!_stalled && !drainBus(_bus.get(), kSlowBusLimit)) {
        _stalled = true;
        ::eventfd_write(_queuedDescriptor, 1);
    }
}

bool BusPoster::post(const Notification& notification) {
    requireNotificationName(notification.name);
    Lock guard(_mutex);
    for (int attempt = 0; attempt < 2; ++attempt) {
        if (!ready() && !connect()) return false;
        int result = send(notification);
        if (result >= 0) {
            watchQueue();
            return true;
        }
        if (result == -ENOBUFS) return false;
        if (sd_bus_is_open(_bus.get()) > 0) {
            CXLog("Notification %@ cannot be sent: %@.", notification.name, std::strerror(-result));
            return false;
        }
        _bus.reset();
    }
    return false;
}

bool BusPoster::connected() {
    Lock guard(_mutex);
    return pump();
}

bool BusPoster::writeQueued() {
    Lock guard(_mutex);
    eventfd_t ignored;
    ::eventfd_read(_queuedDescriptor, &ignored);
    if (!pump()) return true;
    uint64_t queued = 0;
    bool empty = sd_bus_get_n_queued_write(_bus.get(), &queued) < 0 || queued == 0;
    if (empty) _stalled = false;
    return empty;
}

} // namespace rolvane
