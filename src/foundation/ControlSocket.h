#pragma once

#include <string>
#include <sys/types.h>
#include <utility>

namespace rolvane {

// A file descriptor that is closed with its owner.
class OwnedDescriptor {
public:
    explicit OwnedDescriptor(int fd = -1) : _fd(fd) {}
    OwnedDescriptor(OwnedDescriptor&& other) noexcept : _fd(std::exchange(other._fd, -1)) {}
    OwnedDescriptor& operator=(OwnedDescriptor&& other) noexcept;
    ~OwnedDescriptor();
    int get() const { return _fd; }
    explicit operator bool() const { return _fd >= 0; }

private:
    int _fd;
};

// Stream sockets with a path, of any length; non-blocking. Both ends are of one user: a peer that is not is let go.

// Where the daemon of this state directory listens: in the runtime directory, by a name of its own; in the state
// directory where there is no runtime directory.
std::string controlSocketPath();
// Takes the place of whatever lies at the path, so only who may do that calls it. Mode 0600. CXException on failure.
OwnedDescriptor listenAtPath(const std::string& path);
// None when nobody listens there, or somebody else than this user.
OwnedDescriptor connectToPath(const std::string& path);
bool isOfThisUser(int socket); // its peer
pid_t processOf(int socket);   // its peer that connected; 0 when the kernel does not say

} // namespace rolvane
