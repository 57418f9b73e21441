#include "foundation/DaemonNotifications.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"

#include <atomic>
#include <fmt/format.h>

namespace rolvane {

namespace {

constexpr const char* kProgress = "CXDSyncProgressNotification";
constexpr size_t kMostKept = 1000; // notifications that come while the daemon starts

// The notification with an id, which no other one has.
Notification withId(const Notification& notification) {
    static const std::string process = makeUUID();
    static std::atomic<uint64_t> count = 0;
    Notification out{notification.name, notification.object, notification.userInfo.mutableCopy()};
    out.userInfo.set(kPostIdKey, fmt::format("{}-{}", process, ++count));
    return out;
}

struct Observed : Observation {
    Observed(ObservationHandle i, std::function<void()> e) : inner(std::move(i)), ended(std::move(e)) {}
    ~Observed() override {
        inner.reset();
        ended();
    }
    ObservationHandle inner;
    std::function<void()> ended;
};

} // namespace

// -- the daemon

DaemonChannel::DaemonChannel(RunLoop& loop) : _bus(loop, sessionBusAddress()) {}

DaemonChannel::~DaemonChannel() = default;

void DaemonChannel::listen(const std::string& path) {
    ControlServer::Callbacks callbacks;
    callbacks.arrived = [this](const Notification& notification) { arrived(notification); };
    callbacks.observes = [this](const std::string& name) {
        const Lock guard(_mutex);
        return !_serving || _bus.delivery()->queue().observes(name);
    };
    callbacks.mayBeDropped = [](const std::string& name) { return name == kProgress; };
    try {
        _server = std::make_unique<ControlServer>(path, std::move(callbacks));
    } catch (const CXException& e) {
        CXLog("Commands reach this daemon by the session bus only: %@", e.reason());
    }
}

void DaemonChannel::arrived(const Notification& notification) {
    {
        const Lock guard(_mutex);
        if (!_serving) {
            if (_kept.size() < kMostKept) _kept.push_back(notification);
            return;
        }
    }
    _bus.delivery()->arriveFromAnyThread(notification);
}

void DaemonChannel::serve() {
    std::vector<Notification> kept;
    {
        const Lock guard(_mutex);
        _serving = true;
        kept.swap(_kept);
    }
    for (const Notification& notification : kept) _bus.delivery()->arriveFromAnyThread(notification);
}

void DaemonChannel::removeFile() const {
    if (_server) _server->removeFile();
}

bool DaemonChannel::post(const Notification& notification) {
    const Notification marked = withId(notification);
    bool onSocket = false;
    try {
        onSocket = _server && _server->post(marked);
    } catch (const CXException& e) {
        CXLog("Notification %@ cannot be sent: %@", notification.name, e.reason());
    }
    return _bus.post(marked) || onSocket;
}

ObservationHandle DaemonChannel::observe(std::string name, NotificationHandler handler, bool coalesce) {
    return _bus.observe(std::move(name), std::move(handler), coalesce);
}

bool DaemonChannel::connected() const {
    return _bus.connected() || _server;
}

// -- a command

DaemonLink::DaemonLink(RunLoop& loop, ControlClient::Finder find)
    : _bus(loop, sessionBusAddress()),
      _socket(std::make_shared<ControlClient>(loop, std::move(find),
                                              [weak = std::weak_ptr(_bus.delivery())](Notification notification) {
                                                  if (const auto delivery = weak.lock())
                                                      delivery->arrive(std::move(notification));
                                              })) {}

bool DaemonLink::post(const Notification& notification) {
    const Notification marked = withId(notification);
    const bool onSocket = _socket->post(marked);
    return _bus.post(marked) || onSocket;
}

std::optional<int64_t> DaemonLink::postForAnswer(const Notification& notification) {
    const Notification marked = withId(notification);
    const auto number = _socket->postForAnswer(marked);
    _bus.post(marked);
    return number;
}

ObservationHandle DaemonLink::observe(std::string name, NotificationHandler handler, bool coalesce) {
    auto inner = _bus.observe(std::move(name), std::move(handler), coalesce);
    _socket->observe(_bus.delivery()->queue().names());
    return std::make_unique<Observed>(std::move(inner),
                                      [socket = std::weak_ptr(_socket), delivery = std::weak_ptr(_bus.delivery())] {
                                          const auto alive = socket.lock();
                                          const auto queue = delivery.lock();
                                          if (alive && queue) alive->observe(queue->queue().names());
                                      });
}

} // namespace rolvane
