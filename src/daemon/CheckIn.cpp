#include "daemon/CheckIn.h"

#include <cerrno>
#include <fcntl.h>
#include <map>
#include <memory>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>
#include <utility>

namespace rolvane {

namespace {

// Reads and forgets what is waiting on a descriptor; never blocks. False when nothing can come any more.
bool drain(int fd) {
    char scratch[4096];
    for (;;) {
        const ssize_t n = ::read(fd, scratch, sizeof scratch);
        if (n > 0 || (n < 0 && errno == EINTR)) continue;
        return n < 0 && errno == EAGAIN;
    }
}

// A stream that its peer has closed would be ready for ever. (A datagram may be empty; that is no end.)
bool endsWithItsPeer(int fd) {
    return sd_is_fifo(fd, nullptr) > 0 || sd_is_socket(fd, AF_UNSPEC, SOCK_STREAM, 0) > 0;
}

// Peers whose message has not come yet, with the sources that wait for it.
using Peers = std::map<int, RunLoop::Handle>;

void letGo(Peers& peers, int peer) {
    peers.erase(peer);
    ::close(peer);
}

// A message on demand: its only meaning is that the daemon is wanted, and it runs already. It is read once it has come,
// so that its sender is not cut off, and forgotten. A peer that says nothing gives way when there are too many.
void acceptPeers(RunLoop& loop, int fd, const std::shared_ptr<Peers>& peers) {
    constexpr size_t kMostWaiting = 64;
    for (;;) {
        const int peer = ::accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (peer < 0) {
            if (errno == EINTR || errno == ECONNABORTED) continue;
            return;
        }
        if (peers->size() == kMostWaiting) letGo(*peers, peers->begin()->first);
        (*peers)[peer] = loop.addPort(peer, [peer, own = std::weak_ptr(peers)](uint32_t) {
            drain(peer);
            if (const auto held = own.lock()) letGo(*held, peer);
        });
    }
}

void makeNonBlocking(int fd) {
    const int flags = ::fcntl(fd, F_GETFL);
    if (flags >= 0) ::fcntl(fd, F_SETFL, flags | O_NONBLOCK);
}

} // namespace

CheckInPorts::CheckInPorts(CheckInPorts&& other) noexcept
    : _sources(std::move(other._sources)), _idle(std::exchange(other._idle, -1)), _fromLauncher(other._fromLauncher) {}

CheckInPorts::~CheckInPorts() {
    _sources.clear();
    if (_idle >= 0) ::close(_idle);
}

CheckInPorts CXDCheckIn(RunLoop& loop) {
    CheckInPorts ports;
    const int passed = sd_listen_fds(1);
    for (int i = 0; i < passed; ++i) {
        const int fd = SD_LISTEN_FDS_START + i;
        const bool listening = sd_is_socket(fd, AF_UNSPEC, SOCK_STREAM, 1) > 0;
        if (!listening && sd_is_socket(fd, AF_UNSPEC, 0, -1) <= 0 && sd_is_fifo(fd, nullptr) <= 0) continue;
        makeNonBlocking(fd);
        const bool mayEnd = !listening && endsWithItsPeer(fd);
        const auto source = std::make_shared<RunLoop::Handle>();
        const auto peers = std::make_shared<Peers>();
        *source = loop.addPort(fd, [&loop, fd, listening, mayEnd, peers, own = std::weak_ptr(source)](uint32_t) {
            if (listening)
                acceptPeers(loop, fd, peers);
            else if (!drain(fd) && mayEnd)
                if (const auto held = own.lock()) held->reset();
        });
        ports._sources.push_back(source);
        ports._fromLauncher = true;
    }
    if (!ports._fromLauncher) {
        ports._idle = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
        if (ports._idle >= 0)
            ports._sources.push_back(std::make_shared<RunLoop::Handle>(
                loop.addPort(ports._idle, [fd = ports._idle](uint32_t) { drain(fd); })));
    }
    return ports;
}

} // namespace rolvane
