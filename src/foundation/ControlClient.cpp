#include "foundation/ControlClient.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"

#include <algorithm>
#include <cerrno>
#include <poll.h>
#include <sys/socket.h>

namespace rolvane {

namespace {

constexpr double kLookAgain = 0.1;       // seconds between two looks for a daemon
constexpr int kWriteMilliseconds = 200;  // for a socket that is full
constexpr size_t kMostAnswersKept = 100; // that nobody asked for

// All of it; false when the peer does not take it.
bool writeAll(int socket, std::string_view rest) {
    while (!rest.empty()) {
        const ssize_t n = ::send(socket, rest.data(), rest.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && errno == EAGAIN) {
            pollfd room{socket, POLLOUT, 0};
            if (::poll(&room, 1, kWriteMilliseconds) > 0) continue;
        }
        if (n < 0) return false;
        rest.remove_prefix(static_cast<size_t>(n));
    }
    return true;
}

} // namespace

ControlClient::ControlClient(RunLoop& loop, Finder find, std::function<void(Notification)> arrived)
    : _loop(loop), _find(std::move(find)), _arrived(std::move(arrived)) {}

ControlClient::~ControlClient() {
    _look.reset();
    _port.reset();
}

bool ControlClient::connected() const {
    const RecursiveLock guard(_mutex);
    return static_cast<bool>(_socket);
}

bool ControlClient::connect() {
    const RecursiveLock guard(_mutex);
    if (!connectLocked()) return false;
    if (!_port) _port = _loop.addPort(_socket.get(), [this](uint32_t) { read(); });
    return true;
}

// With _mutex held; the port is added on the loop's thread.
bool ControlClient::connectLocked() {
    if (_socket) return true;
    const auto path = _find();
    if (path) _socket = connectToPath(*path);
    if (!_socket) return false;
    ControlMessage names;
    names.kind = ControlMessage::Kind::observe;
    names.names = _names;
    if (!_names.empty()) writeAll(_socket.get(), names.frame());
    return true;
}

void ControlClient::observe(std::vector<std::string> names) {
    {
        const RecursiveLock guard(_mutex);
        if (names == _names) return;
        _names = std::move(names);
        ControlMessage message;
        message.kind = ControlMessage::Kind::observe;
        message.names = _names;
        if (_socket) writeAll(_socket.get(), message.frame());
    }
    if (!connect()) lookLater();
}

void ControlClient::lookLater() {
    {
        const RecursiveLock guard(_mutex);
        if (_names.empty() || _look) return;
    }
    _look = _loop.scheduleTimer(kLookAgain, [this] {
        const RunLoop::Handle fired = std::move(_look);
        if (!connect()) lookLater();
    });
}

bool ControlClient::send(ControlMessage message) {
    const RecursiveLock guard(_mutex);
    const std::string frame = message.frame();
    // A daemon that was started anew meanwhile is met at the second attempt.
    for (int attempt = 0; attempt < 2; ++attempt) {
        if (!connectLocked()) return false;
        if (writeAll(_socket.get(), frame)) return true;
        if (_port) return false; // `read` sees its end
        _socket = OwnedDescriptor();
    }
    return false;
}

bool ControlClient::post(const Notification& notification) {
    ControlMessage message;
    message.kind = ControlMessage::Kind::post;
    message.notification = notification;
    try {
        return send(std::move(message));
    } catch (const CXException& e) {
        CXLog("Notification %@ cannot be sent: %@", notification.name, e.reason());
        return false;
    }
}

std::optional<int64_t> ControlClient::sendForAnswer(ControlMessage message) {
    if (!connect()) return std::nullopt;
    message.number = ++_lastNumber;
    if (!send(message)) return std::nullopt;
    return message.number;
}

std::optional<int64_t> ControlClient::postForAnswer(const Notification& notification) {
    ControlMessage message;
    message.kind = ControlMessage::Kind::post;
    message.notification = notification;
    return sendForAnswer(std::move(message));
}

std::optional<int64_t> ControlClient::ask() {
    ControlMessage message;
    message.kind = ControlMessage::Kind::ask;
    return sendForAnswer(std::move(message));
}

std::optional<bool> ControlClient::heard(int64_t number) const {
    const auto found = _heard.find(number);
    return found == _heard.end() ? std::nullopt : std::optional(found->second);
}

void ControlClient::read() {
    char bytes[16384];
    int socket = -1;
    {
        const RecursiveLock guard(_mutex);
        socket = _socket.get();
    }
    try {
        for (;;) {
            const ssize_t n = ::recv(socket, bytes, sizeof bytes, MSG_DONTWAIT);
            if (n < 0 && errno == EINTR) continue;
            if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return;
            if (n <= 0) return lost();
            _reader.append({bytes, static_cast<size_t>(n)});
            while (auto message = _reader.next()) {
                if (message->kind == ControlMessage::Kind::post) _arrived(std::move(message->notification));
                if (message->kind != ControlMessage::Kind::heard) continue;
                _heard[message->number] = message->observed;
                if (_heard.size() > kMostAnswersKept) _heard.erase(_heard.begin());
            }
        }
    } catch (const CXException& e) {
        CXLog("What the daemon says on its control socket cannot be read: %@", e.reason());
        lost();
    }
}

void ControlClient::lost() {
    {
        const RecursiveLock guard(_mutex);
        _port.reset();
        _socket = OwnedDescriptor();
        _reader = ControlReader();
    }
    lookLater();
}

} // namespace rolvane
