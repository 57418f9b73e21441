#include "foundation/ControlServer.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"

#include <algorithm>
#include <cerrno>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int kBacklogATurn = 64;
constexpr int kRestMilliseconds = 1000; // when no descriptor is left for another peer

} // namespace

ControlServer::ControlServer(std::string path, Callbacks callbacks)
    : _path(std::move(path)), _callbacks(std::move(callbacks)), _listening(listenAtPath(_path)),
      _woken(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)), _thread([this] { serve(); }) {}

ControlServer::~ControlServer() {
    {
        const Lock guard(_mutex);
        _ended = true;
    }
    wake();
    _thread.join();
    removeFile();
}

void ControlServer::removeFile() const {
    ::unlink(_path.c_str());
}

void ControlServer::wake() const {
    ::eventfd_write(_woken.get(), 1);
}

bool ControlServer::post(const Notification& notification) {
    const Lock guard(_mutex);
    std::string bytes;
    bool rest = false;
    for (auto& [fd, peer] : _peers) {
        if (peer.gone || !peer.observed.contains(notification.name)) continue;
        if (bytes.empty()) {
            ControlMessage message;
            message.kind = ControlMessage::Kind::post;
            message.notification = notification;
            bytes = message.frame();
        }
        const bool droppable = _callbacks.mayBeDropped && _callbacks.mayBeDropped(notification.name);
        if (!droppable || peer.waiting.size() < kDropsFrom) write(peer, bytes);
        rest = rest || peer.gone || !peer.waiting.empty();
    }
    if (rest) wake(); // its thread writes the rest, and takes leave of who is gone
    return !bytes.empty();
}

void ControlServer::write(Peer& peer, const std::string& bytes) {
    peer.waiting += bytes;
    flush(peer);
    peer.gone = peer.gone || peer.waiting.size() > kMostWaiting;
}

void ControlServer::flush(Peer& peer) {
    size_t sent = 0;
    while (sent < peer.waiting.size()) {
        const ssize_t n = ::send(peer.socket.get(), peer.waiting.data() + sent, peer.waiting.size() - sent,
                                 MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            peer.gone = peer.gone || (errno != EAGAIN && errno != EWOULDBLOCK);
            break;
        }
        sent += static_cast<size_t>(n);
    }
    peer.waiting.erase(0, sent);
}

void ControlServer::serve() {
    bool crowded = false;
    for (;;) {
        std::vector<pollfd> ready{{_woken.get(), POLLIN, 0},
                                  {_listening.get(), static_cast<short>(crowded ? 0 : POLLIN), 0}};
        {
            const Lock guard(_mutex);
            if (_ended) return;
            std::erase_if(_peers, [](const auto& entry) { return entry.second.gone; });
            for (const auto& [fd, peer] : _peers)
                ready.push_back({fd, static_cast<short>(peer.waiting.empty() ? POLLIN : POLLIN | POLLOUT), 0});
        }
        const int count = ::poll(ready.data(), ready.size(), crowded ? kRestMilliseconds : -1);
        crowded = false;
        if (count <= 0) continue;
        eventfd_t ignored;
        ::eventfd_read(_woken.get(), &ignored);
        for (size_t i = 2; i < ready.size(); ++i) {
            if (!ready[i].revents) continue;
            Lock lock(_mutex);
            Peer& peer = _peers.at(ready[i].fd); // only this thread takes peers out
            if (ready[i].revents & POLLOUT) flush(peer);
            lock.unlock();
            if (ready[i].revents & (POLLIN | POLLHUP | POLLERR)) read(peer);
        }
        if (ready[1].revents) crowded = !accept();
    }
}

bool ControlServer::hasRoomFor(pid_t process) const {
    const auto ofIt = std::count_if(_peers.begin(), _peers.end(),
                                    [process](const auto& entry) { return entry.second.process == process; });
    return _peers.size() < kMostPeers && static_cast<size_t>(ofIt) < kMostOfOneProcess;
}

bool ControlServer::accept() {
    for (int turn = 0; turn < kBacklogATurn; ++turn) {
        OwnedDescriptor socket(::accept4(_listening.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
        if (!socket) {
            if (errno == EINTR || errno == ECONNABORTED) continue;
            return errno != EMFILE && errno != ENFILE;
        }
        const Lock guard(_mutex);
        const pid_t process = processOf(socket.get());
        if (!isOfThisUser(socket.get()) || !hasRoomFor(process)) continue;
        const int fd = socket.get();
        Peer& peer = _peers[fd];
        peer.socket = std::move(socket);
        peer.process = process;
    }
    return true;
}

// Reader and socket are this thread's alone; the rest of a peer is touched under the lock.
void ControlServer::read(Peer& peer) {
    char bytes[16384];
    bool ended = false;
    try {
        for (size_t turn = 0; turn < kMostATurn;) {
            const ssize_t n = ::recv(peer.socket.get(), bytes, sizeof bytes, MSG_DONTWAIT);
            if (n < 0 && errno == EINTR) continue;
            ended = n == 0 || (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK);
            if (n <= 0) break;
            turn += static_cast<size_t>(n);
            peer.reader.append({bytes, static_cast<size_t>(n)});
            while (const auto message = peer.reader.next()) answer(peer, *message);
        }
    } catch (const CXException& e) {
        CXLog("A peer of the control socket is let go: %@", e.reason());
        ended = true;
    }
    const Lock guard(_mutex);
    peer.gone = peer.gone || ended;
}

void ControlServer::answer(Peer& peer, const ControlMessage& message) {
    using Kind = ControlMessage::Kind;
    if (message.names.size() > kMostNames)
        throw CXException(kCXArchiveException, "A message on the control socket names too much.");
    ControlMessage heard;
    heard.kind = Kind::heard;
    heard.number = message.number;
    if (message.kind == Kind::post) {
        heard.observed = _callbacks.observes(message.notification.name);
        _callbacks.arrived(message.notification);
    }
    const Lock guard(_mutex);
    if (message.kind == Kind::observe) peer.observed = {message.names.begin(), message.names.end()};
    if (message.number != 0 && message.kind != Kind::heard) write(peer, heard.frame());
}

} // namespace rolvane
