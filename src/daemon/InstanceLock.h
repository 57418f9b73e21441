#pragma once

#include <optional>
#include <string>
#include <sys/types.h>

namespace rolvane {

// One daemon a user and state directory: a lock that dies with the process. The file names the process in its first
// line, and in the second where the process listens.
class InstanceLock {
public:
    // Nothing when another process holds the lock. Throws CXException when the file cannot be made.
    static std::optional<InstanceLock> acquire(const std::string& path, const std::string& listensAt = {});
    // The process that holds the lock now, if any does.
    static std::optional<pid_t> holder(const std::string& path);
    // The path that it gave; none when nobody holds the lock, or its holder gave none.
    static std::optional<std::string> holderListensAt(const std::string& path);
    static std::string defaultPath(); // stateDirectory()/RolvaneManager.lock

    InstanceLock(InstanceLock&& other) noexcept;
    InstanceLock& operator=(InstanceLock&&) = delete;
    ~InstanceLock();

private:
    explicit InstanceLock(int fd) : _fd(fd) {}
    static std::optional<std::string> textOfHolder(const std::string& path);
    int _fd;
};

} // namespace rolvane
