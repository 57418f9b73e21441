#include "foundation/ControlSocket.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/SystemError.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int kBacklog = 64;

// FNV-1a; tells the daemons of several state directories apart that share a runtime directory.
uint64_t digestOf(const std::string& text) {
    uint64_t digest = 0xcbf29ce484222325u;
    for (const char c : text) digest = (digest ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
    return digest;
}

// The address of a path. One that is too long for an address is reached through its directory, which stays open.
struct Address {
    explicit Address(const std::string& path) {
        address.sun_family = AF_UNIX;
        std::string name = path;
        if (name.size() >= sizeof address.sun_path) {
            const size_t slash = path.rfind('/');
            directory = OwnedDescriptor(
                ::open(path.substr(0, std::max<size_t>(slash, 1)).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
            name = fmt::format("/proc/self/fd/{}{}", directory.get(), path.substr(slash));
            fits = static_cast<bool>(directory) && name.size() < sizeof address.sun_path;
        }
        if (fits) std::memcpy(address.sun_path, name.c_str(), name.size() + 1);
    }
    const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&address); }

    sockaddr_un address{};
    OwnedDescriptor directory;
    bool fits = true;
};

OwnedDescriptor newSocket() {
    return OwnedDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
}

} // namespace

OwnedDescriptor& OwnedDescriptor::operator=(OwnedDescriptor&& other) noexcept {
    std::swap(_fd, other._fd);
    return *this;
}

OwnedDescriptor::~OwnedDescriptor() {
    if (_fd >= 0) ::close(_fd);
}

std::string controlSocketPath() {
    const std::string state = stateDirectory();
    std::string directory = state;
    try {
        directory = runtimeDirectory();
    } catch (const CXException&) { // it cannot be made; the state directory serves as well
    }
    return fmt::format("{}/control-{:016x}", directory, digestOf(state));
}

OwnedDescriptor listenAtPath(const std::string& path) {
    const Address address(path);
    OwnedDescriptor fd = newSocket();
    if (!address.fits) errno = ENAMETOOLONG;
    // The mode of the socket is that of the file that `bind` makes.
    if (!address.fits || !fd || ::fchmod(fd.get(), 0600) != 0 || (::unlink(path.c_str()) != 0 && errno != ENOENT) ||
        ::bind(fd.get(), address.get(), sizeof address.address) != 0 || ::listen(fd.get(), kBacklog) != 0)
        throw cxSystemException("listen at", path, errno);
    return fd;
}

OwnedDescriptor connectToPath(const std::string& path) {
    const Address address(path);
    OwnedDescriptor fd = newSocket();
    if (!address.fits || !fd || ::connect(fd.get(), address.get(), sizeof address.address) != 0 ||
        !isOfThisUser(fd.get()))
        return OwnedDescriptor();
    return fd;
}

pid_t processOf(int socket) {
    ucred peer{};
    socklen_t size = sizeof peer;
    return ::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0 ? peer.pid : 0;
}

bool isOfThisUser(int socket) {
    ucred peer{};
    socklen_t size = sizeof peer;
    return ::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0 && peer.uid == ::geteuid();
}

} // namespace rolvane
