#include "daemon/InstanceLock.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <fmt/format.h>
#include <thread>
#include <unistd.h>
#include <utility>

namespace rolvane {

namespace {

// The locks are of the open file description, so that they die with the process and are not lost when another part of
// the process opens and closes the file; F_OFD_GETLK cannot tell the holder's number, so the file's text does. The
// first byte's lock says that there is a holder, the second's that the number in the file is the holder's.
constexpr off_t kHeld = 0, kNamed = 1;

struct flock writeLockOf(off_t byte) {
    struct flock lock = {};
    lock.l_type = F_WRLCK;
    lock.l_whence = SEEK_SET;
    lock.l_start = byte;
    lock.l_len = 1;
    return lock;
}

bool tryLock(int fd, off_t byte) {
    struct flock lock = writeLockOf(byte);
    return ::fcntl(fd, F_OFD_SETLK, &lock) == 0;
}

bool isLockedByAnother(int fd, off_t byte) {
    struct flock lock = writeLockOf(byte);
    return ::fcntl(fd, F_OFD_GETLK, &lock) == 0 && lock.l_type != F_UNLCK;
}

// Until the holder, which has just come, has put down its number; false when there is none, or none that does.
bool isHeldAndNamed(int fd) {
    constexpr int kTries = 1000;
    for (int i = 0; i < kTries && isLockedByAnother(fd, kHeld); ++i) {
        if (isLockedByAnother(fd, kNamed)) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return false;
}

} // namespace

std::string InstanceLock::defaultPath() {
    return stateDirectory() + "/RolvaneManager.lock";
}

std::optional<InstanceLock> InstanceLock::acquire(const std::string& path, const std::string& listensAt) {
    const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0)
        throw CXException("CXDaemonException",
                          fmt::format("The lock file {} cannot be opened ({}). Check the directory's owner and rights.",
                                      path, std::strerror(errno)));
    InstanceLock lock(fd);
    if (!tryLock(fd, kHeld)) return std::nullopt;
    const std::string text = fmt::format("{}\n{}\n", ::getpid(), listensAt);
    if (::ftruncate(fd, 0) != 0 || ::pwrite(fd, text.data(), text.size(), 0) != static_cast<ssize_t>(text.size()) ||
        !tryLock(fd, kNamed))
        throw CXException("CXDaemonException", fmt::format("The lock file {} cannot be written ({}). Is the disk full?",
                                                           path, std::strerror(errno)));
    return lock;
}

std::optional<std::string> InstanceLock::textOfHolder(const std::string& path) {
    constexpr size_t kMostBytes = 8192;
    const int fd = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    InstanceLock probe(fd);
    if (!isHeldAndNamed(fd)) return std::nullopt;
    std::string text(kMostBytes, '\0');
    const ssize_t n = ::pread(fd, text.data(), text.size(), 0);
    text.resize(n > 0 ? static_cast<size_t>(n) : 0);
    return text;
}

std::optional<pid_t> InstanceLock::holder(const std::string& path) {
    const auto text = textOfHolder(path);
    const long pid = text ? std::strtol(text->c_str(), nullptr, 10) : 0;
    return pid > 0 ? std::optional<pid_t>(static_cast<pid_t>(pid)) : std::nullopt;
}

std::optional<std::string> InstanceLock::holderListensAt(const std::string& path) {
    const std::string text = textOfHolder(path).value_or("");
    const size_t first = text.find('\n'), second = text.find('\n', first + 1);
    if (second == std::string::npos || second == first + 1) return std::nullopt;
    return text.substr(first + 1, second - first - 1);
}

InstanceLock::InstanceLock(InstanceLock&& other) noexcept : _fd(std::exchange(other._fd, -1)) {}

InstanceLock::~InstanceLock() {
    if (_fd >= 0) ::close(_fd);
}

} // namespace rolvane
