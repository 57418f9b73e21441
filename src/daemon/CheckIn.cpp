#include "daemon/CheckIn.h"

#include "foundation/ControlSocket.h"
#include "foundation/Log.h"

#include <cerrno>
#include <cstddef>
#include <cstring>
#include <fcntl.h>
#include <map>
#include <memory>
#include <string>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
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
        if (!isOfThisUser(peer)) {
            ::close(peer);
            continue;
        }
        if (peers->size() == kMostWaiting) letGo(*peers, peers->begin()->first);
        (*peers)[peer] = loop.addPort(peer, [peer, own = std::weak_ptr(peers)](uint32_t) {
            drain(peer);
            if (const auto held = own.lock()) letGo(*held, peer);
        });
    }
}

// Whether a local socket with this path, or its other end where it has none, is this user's.
bool isSocketOfThisUser(int fd) {
    sockaddr_un address{};
    socklen_t size = sizeof address;
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &size) != 0 || address.sun_family != AF_UNIX)
        return false;
    constexpr size_t kHead = offsetof(sockaddr_un, sun_path);
    if (size <= kHead) return isOfThisUser(fd);    // one of a pair
    if (address.sun_path[0] == '\0') return false; // a name that anybody may take, and that anybody reaches
    const std::string path(address.sun_path, ::strnlen(address.sun_path, size - kHead));
    struct stat info {};
    return path[0] == '/' && ::lstat(path.c_str(), &info) == 0 && S_ISSOCK(info.st_mode) && info.st_uid == ::geteuid();
}

bool isFifoOfThisUser(int fd) {
    struct stat info {};
    return sd_is_fifo(fd, nullptr) > 0 && ::fstat(fd, &info) == 0 && info.st_uid == ::geteuid() &&
           (::fcntl(fd, F_GETFL) & O_ACCMODE) != O_WRONLY;
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
        if (!isSocketOfThisUser(fd) && !isFifoOfThisUser(fd)) {
            CXDLog("Descriptor %d of the service launcher is none of this user's and is left alone.", fd);
            continue;
        }
        const bool listening = sd_is_socket(fd, AF_UNIX, SOCK_STREAM, 1) > 0;
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
