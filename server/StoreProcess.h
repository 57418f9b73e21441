#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <sys/types.h>
#include <utility>
#include <vector>

namespace rolvane {

// A file descriptor with an owner.
class FileHandle {
public:
    FileHandle() = default;
    explicit FileHandle(int fd) : _fd(fd) {}
    FileHandle(FileHandle&& other) noexcept : _fd(other.release()) {}
    FileHandle& operator=(FileHandle&& other) noexcept {
        std::swap(_fd, other._fd);
        return *this;
    }
    ~FileHandle();
    int get() const { return _fd; }
    explicit operator bool() const { return _fd >= 0; }
    int release() { return std::exchange(_fd, -1); }

private:
    int _fd = -1;
};

// Whom httpd runs as. An ordinary user's httpd runs as that user.
struct StoreIdentity {
    bool change = false; // true when the launcher is root: change to uid and gid
    uid_t uid = 0;
    gid_t gid = 0;
    std::string name;
    bool passFileModes = false; // keep the right to read and search past file modes
    bool changeFiles = false;   // with passFileModes: and to write

    // www-data, else nobody, for root; the process's own user for anybody else. CXException when root has neither.
    static StoreIdentity choose();
    // The user with that name. CXException when there is none.
    static StoreIdentity named(const std::string& user);
    // Makes this process, which root has started, one of that user's, for good. With `ports` it may go on to listen on
    // ports below 1024, as far as the machine lets it. CXException when it cannot.
    void takeOn(bool ports) const;
    // Whether that user may search every directory on the way to the path, the path itself included.
    bool reaches(const std::string& path) const;
    // Carries the action out as that user, in a process of its own, and returns what the action returned (0 to 255).
    // The action makes system calls and nothing else. CXException when the user cannot be taken on.
    int run(const std::function<int()>& action) const;
};

// A running program, seen through a pidfd, so that a number that was given to somebody else is never taken for it.
class StoreProcess {
public:
    // The process with that number if it was started as httpd with the configuration file, STATE/conf/httpd.conf;
    // nothing else passes for a store.
    static std::optional<StoreProcess> find(pid_t pid, const std::string& configurationFile);
    // Every such process of this machine: httpd's master and its workers.
    static std::vector<StoreProcess> findAll(const std::string& configurationFile);
    // Starts it in a session of its own, standard error and output in the file, no other descriptor inherited.
    // Its environment is a path, a language, TZ and the given variables ("NAME=value") and holds nothing else of this
    // process's: who serves others' requests need not know it. It leaves no core files. CXException when it cannot be
    // run.
    static StoreProcess launch(const std::vector<std::string>& command, const StoreIdentity& identity,
                               const std::string& outputFile, std::vector<std::string> environment = {});

    pid_t pid() const { return _pid; }
    bool hasExited() const { return waitForExit(std::chrono::milliseconds(0)); }
    bool
    waitForExit(std::chrono::milliseconds timeout) const; // false when the time ran out; takes the status of a child
    void signal(int number) const;
    int handle() const { return _handle.get(); } // readable when it has exited

private:
    StoreProcess(pid_t pid, FileHandle handle) : _pid(pid), _handle(std::move(handle)) {}
    pid_t _pid;
    FileHandle _handle;
};

} // namespace rolvane
