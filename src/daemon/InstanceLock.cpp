#include "daemon/InstanceLock.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>
#include <utility>

namespace rolvane {

namespace {

// The lock is of the open file description, so that it dies with the process and is not lost when another part of the
// process opens and closes the file; F_OFD_GETLK cannot tell the holder's number, so the file's text does.
bool tryLock(int fd, short type) {
    struct flock lock = {};
    lock.l_type = type;
    lock.l_whence = SEEK_SET;
    return ::fcntl(fd, F_OFD_SETLK, &lock) == 0;
}

} // namespace

std::string InstanceLock::defaultPath() {
    return stateDirectory() + "/RolvaneManager.lock";
}

std::optional<InstanceLock> InstanceLock::acquire(const std::string& path) {
    const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0)
        throw CXException("CXDaemonException",
                          fmt::format("The lock file {} cannot be opened ({}). Check the directory's owner and rights.",
                                      path, std::strerror(errno)));
    InstanceLock lock(fd);
    if (!tryLock(fd, F_WRLCK)) return std::nullopt;
    const std::string text = fmt::format("{}\n", ::getpid());
    if (::ftruncate(fd, 0) != 0 || ::pwrite(fd, text.data(), text.size(), 0) != static_cast<ssize_t>(text.size()))
        throw CXException("CXDaemonException", fmt::format("The lock file {} cannot be written ({}). Is the disk full?",
                                                           path, std::strerror(errno)));
    return lock;
}

std::optional<pid_t> InstanceLock::holder(const std::string& path) {
    const int fd = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    InstanceLock probe(fd);
    struct flock lock = {};
    lock.l_type = F_WRLCK;
    lock.l_whence = SEEK_SET;
    if (::fcntl(fd, F_OFD_GETLK, &lock) != 0 || lock.l_type == F_UNLCK) return std::nullopt;
    char text[32] = {};
    const ssize_t n = ::pread(fd, text, sizeof text - 1, 0);
    const long pid = n > 0 ? std::strtol(text, nullptr, 10) : 0;
    return pid > 0 ? std::optional<pid_t>(static_cast<pid_t>(pid)) : std::nullopt;
}

InstanceLock::InstanceLock(InstanceLock&& other) noexcept : _fd(std::exchange(other._fd, -1)) {}

InstanceLock::~InstanceLock() {
    if (_fd >= 0) ::close(_fd);
}

} // namespace rolvane
