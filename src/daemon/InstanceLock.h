#pragma once

#include <optional>
#include <string>
#include <sys/types.h>

namespace rolvane {

// One daemon a user and state directory: a lock file that dies with the process and names it.
class InstanceLock {
public:
    // Nothing when another process holds the lock. Throws CXException when the file cannot be made.
    static std::optional<InstanceLock> acquire(const std::string& path);
    // The process that holds the lock now, if any does.
    static std::optional<pid_t> holder(const std::string& path);
    static std::string defaultPath(); // stateDirectory()/RolvaneManager.lock

    InstanceLock(InstanceLock&& other) noexcept;
    InstanceLock& operator=(InstanceLock&&) = delete;
    ~InstanceLock();

private:
    explicit InstanceLock(int fd) : _fd(fd) {}
    int _fd;
};

} // namespace rolvane
