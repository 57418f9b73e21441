#include "foundation/BusNotifications.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/NotificationMessage.h"
#include "foundation/RunLoop.h"

#include <algorithm>
#include <map>

#include <systemd/sd-event.h>

namespace rolvane {

namespace {

using namespace std::chrono_literals;

constexpr auto kConnectLimit = 500ms;
constexpr uint64_t kCallLimitMicroseconds = 2'000'000; // of a subscription's confirmation
constexpr uint64_t kQueuedRetryMicroseconds = 20'000;
constexpr double kFirstRetry = 0.1, kLongestRetry = 5; // seconds between attempts to find the bus again

struct SlotCloser {
    void operator()(sd_bus_slot* slot) const { sd_bus_slot_unref(slot); }
};
using Slot = std::unique_ptr<sd_bus_slot, SlotCloser>;

std::string matchRule(const std::string& name) {
    return std::string("type='signal',path='") + kNotificationPath + "',interface='" + kNotificationInterface +
           "',member='" + name + "'";
}

} // namespace

// The connection that observed signals come in on: one match a name, attached to the run loop, found again when it was
// lost. The loop's thread.
class BusReceiver : public std::enable_shared_from_this<BusReceiver> {
public:
    BusReceiver(std::shared_ptr<LoopDelivery> delivery, std::optional<std::string> address)
        : _delivery(std::move(delivery)), _address(std::move(address)) {}

    ObservationHandle observe(std::string name, NotificationHandler handler, bool coalesce);
    void end(const std::shared_ptr<DeliveryQueue::Observer>& observer);

private:
    static int signalReceived(sd_bus_message* message, void* receiver, sd_bus_error*);
    static int messageReceived(sd_bus_message* message, void* receiver, sd_bus_error*);
    void connect();
    bool addMatch(const std::string& name);
    void connectionLost();
    void retryLater();

    const std::shared_ptr<LoopDelivery> _delivery;
    const std::optional<std::string> _address;
    double _retry = kFirstRetry;
    RunLoop::Handle _retryTimer;
    Bus _bus;
    Slot _filter;
    std::map<std::string, Slot> _matches; // by name
};

namespace {

struct Registration : Observation {
    Registration(std::weak_ptr<BusReceiver> r, std::shared_ptr<DeliveryQueue::Observer> o)
        : receiver(std::move(r)), observer(std::move(o)) {}
    ~Registration() override {
        observer->ended = true;
        if (auto alive = receiver.lock()) alive->end(observer);
    }
    std::weak_ptr<BusReceiver> receiver;
    std::shared_ptr<DeliveryQueue::Observer> observer;
};

} // namespace

ObservationHandle BusReceiver::observe(std::string name, NotificationHandler handler, bool coalesce) {
    requireNotificationName(name);
    auto observer = _delivery->queue().add(name, std::move(handler), coalesce);
    if (_bus && !_matches.contains(name)) {
        if (!addMatch(name)) connectionLost();
    } else if (!_bus && !_retryTimer) {
        connect();
    }
    return std::make_unique<Registration>(weak_from_this(), std::move(observer));
}

void BusReceiver::end(const std::shared_ptr<DeliveryQueue::Observer>& observer) {
    _delivery->queue().end(observer);
    if (!_delivery->queue().observes(observer->name)) _matches.erase(observer->name);
}

bool BusReceiver::addMatch(const std::string& name) {
    sd_bus_slot* slot = nullptr;
    if (sd_bus_add_match(_bus.get(), &slot, matchRule(name).c_str(), signalReceived, this) < 0) return false;
    _matches[name].reset(slot);
    return true;
}

void BusReceiver::connect() {
    _retryTimer.reset();
    if (!_address) return;
    _bus = connectBus(*_address, kConnectLimit);
    if (!_bus) return retryLater();
    sd_bus_set_method_call_timeout(_bus.get(), kCallLimitMicroseconds);
    sd_bus_slot* slot = nullptr;
    bool good = sd_bus_add_filter(_bus.get(), &slot, messageReceived, this) >= 0;
    _filter.reset(slot);
    auto names = _delivery->queue().names();
    good = good && std::all_of(names.begin(), names.end(), [&](const auto& name) { return addMatch(name); }) &&
           sd_bus_attach_event(_bus.get(), _delivery->loop().event(), SD_EVENT_PRIORITY_NORMAL) >= 0;
    if (!good) return connectionLost();
    _retry = kFirstRetry;
}

// Not called from within the connection's own callbacks.
void BusReceiver::connectionLost() {
    _matches.clear();
    _filter.reset();
    if (_bus) sd_bus_detach_event(_bus.get());
    _bus.reset();
    retryLater();
}

void BusReceiver::retryLater() {
    if (_delivery->queue().names().empty()) return; // `observe` connects when there is something to hear
    auto again = [weak = weak_from_this()] {
        if (auto self = weak.lock()) self->connect();
    };
    _retryTimer = _delivery->loop().scheduleTimer(_retry, again);
    _retry = std::min(_retry * 2, kLongestRetry);
}

int BusReceiver::signalReceived(sd_bus_message* message, void* userdata, sd_bus_error*) {
    auto* self = static_cast<BusReceiver*>(userdata);
    try {
        self->_delivery->arrive(readNotificationMessage(message));
    } catch (const CXException& e) {
        CXLog("A notification cannot be read: %@", e);
    }
    return 0;
}

int BusReceiver::messageReceived(sd_bus_message* message, void* userdata, sd_bus_error*) {
    auto* self = static_cast<BusReceiver*>(userdata);
    if (sd_bus_message_is_signal(message, "org.freedesktop.DBus.Local", "Disconnected") > 0)
        self->_delivery->loop().performAfterDelay(0, [weak = self->weak_from_this()] {
            if (auto alive = weak.lock()) alive->connectionLost();
        });
    return 0;
}

BusNotifications::BusNotifications(RunLoop& loop, const std::optional<std::string>& address)
    : _poster(address), _delivery(std::make_shared<LoopDelivery>(loop)),
      _receiver(std::make_shared<BusReceiver>(_delivery, address)) {
    sd_event_source* source = nullptr;
    if (sd_event_add_io(loop.event(), &source, _poster.queuedDescriptor(), EPOLLIN, somethingQueued, this) >= 0)
        _queuedSource.reset(source);
    if (sd_event_add_time_relative(loop.event(), &source, CLOCK_MONOTONIC, 0, 1000, retryElapsed, this) >= 0) {
        _queuedRetry.reset(source);
        sd_event_source_set_enabled(source, SD_EVENT_OFF);
    }
}

BusNotifications::~BusNotifications() = default;

void BusNotifications::SourceCloser::operator()(sd_event_source* source) const {
    sd_event_source_disable_unref(source);
}

ObservationHandle BusNotifications::observe(std::string name, NotificationHandler handler, bool coalesce) {
    return _receiver->observe(std::move(name), std::move(handler), coalesce);
}

int BusNotifications::somethingQueued(sd_event_source*, int, uint32_t, void* self) {
    return static_cast<BusNotifications*>(self)->writeQueued();
}

int BusNotifications::retryElapsed(sd_event_source*, uint64_t, void* self) {
    return static_cast<BusNotifications*>(self)->writeQueued();
}

// In the first half of a turn, so that it happens within handlers that run the loop once, too.
int BusNotifications::writeQueued() {
    if (_poster.writeQueued()) return 0;
    sd_event_source_set_time_relative(_queuedRetry.get(), kQueuedRetryMicroseconds);
    sd_event_source_set_enabled(_queuedRetry.get(), SD_EVENT_ONESHOT);
    return 0;
}

std::unique_ptr<DistributedNotifications> makeBusNotifications(RunLoop& loop, std::optional<std::string> address) {
    return std::make_unique<BusNotifications>(loop, address ? std::move(address) : sessionBusAddress());
}

} // namespace rolvane
