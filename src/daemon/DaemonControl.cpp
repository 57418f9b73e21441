#include "daemon/DaemonControl.h"

#include "daemon/InstanceLock.h"
#include "foundation/Paths.h"
#include "foundation/QuietProgram.h"

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fmt/format.h>
#include <poll.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>
#include <vector>

extern char** environ; // NOLINT: POSIX declares it nowhere

namespace rolvane {

namespace {

constexpr const char* kUnit = "RolvaneManager.service";

[[noreturn]] void fail(const std::string& reason) {
    throw CXException("CXDaemonException", reason);
}

class Descriptor {
public:
    explicit Descriptor(int fd) : _fd(fd) {}
    Descriptor(Descriptor&& other) noexcept : _fd(std::exchange(other._fd, -1)) {}
    Descriptor& operator=(Descriptor&&) = delete;
    ~Descriptor() {
        if (_fd >= 0) ::close(_fd);
    }
    int get() const { return _fd; }

private:
    int _fd;
};

Descriptor processDescriptor(pid_t pid) {
    return Descriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

// True when the descriptor became readable in time.
bool waitReadable(int fd, double seconds) {
    pollfd p{fd, POLLIN, 0};
    const auto end = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    for (;;) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
        const int n = ::poll(&p, 1, static_cast<int>(std::max<long long>(0, left.count())));
        if (n >= 0 || errno != EINTR) return n > 0;
    }
}

// Where the daemon says that it is ready: a socket without a file, which is gone with this process however it ends.
// Only what a process of this user says counts.
class NotifySocket {
public:
    NotifySocket() : _name("rolvane-notify-" + makeUUID()), _fd(open(_name)) {}
    std::string path() const { return "@" + _name; } // as sd_notify wants it
    int get() const { return _fd.get(); }
    bool ready() const {
        char text[512];
        alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
        iovec bytes{text, sizeof text};
        msghdr message{};
        message.msg_iov = &bytes;
        message.msg_iovlen = 1;
        message.msg_control = control;
        message.msg_controllen = sizeof control;
        const ssize_t n = ::recvmsg(_fd.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
        const cmsghdr* header = n > 0 ? CMSG_FIRSTHDR(&message) : nullptr;
        if (!header || header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_CREDENTIALS) return false;
        ucred sender{};
        std::memcpy(&sender, CMSG_DATA(header), sizeof sender);
        return sender.uid == ::geteuid() &&
               std::string_view(text, static_cast<size_t>(n)).find("READY=1") != std::string_view::npos;
    }

private:
    static Descriptor open(const std::string& name) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::memcpy(address.sun_path + 1, name.data(), name.size()); // the first byte is zero: no file
        const auto size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + name.size());
        Descriptor fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
        const int on = 1;
        if (fd.get() < 0 || ::setsockopt(fd.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0 ||
            ::bind(fd.get(), reinterpret_cast<const sockaddr*>(&address), size) != 0)
            fail(fmt::format("A socket for the daemon's answer cannot be made ({}).", std::strerror(errno)));
        return fd;
    }
    std::string _name;
    Descriptor _fd;
};

std::string ownDirectory() {
    std::error_code error;
    const auto program = std::filesystem::read_symlink("/proc/self/exe", error);
    return error ? std::string() : program.parent_path().string();
}

std::string logTail(const std::string& path, size_t bytes) {
    try {
        std::string text = readFile(path);
        if (text.ends_with('\n')) text.pop_back();
        const std::string tail = text.size() > bytes ? text.substr(text.size() - bytes) : text;
        const size_t lastLine = tail.find_last_of('\n');
        return lastLine == std::string::npos ? tail : tail.substr(lastLine + 1);
    } catch (const CXException&) {
        return {};
    }
}

} // namespace

DaemonControl::DaemonControl(Options options) : _options(std::move(options)) {}

std::string DaemonControl::logPath() {
    return stateDirectory() + "/RolvaneManager.log";
}

std::string DaemonControl::programPath() const {
    std::vector<std::string> places;
    if (!_options.program.empty()) places.push_back(_options.program);
    if (const char* named = std::getenv("ROLVANE_MANAGER"); named && *named) places.emplace_back(named);
    if (const std::string here = ownDirectory(); !here.empty())
        for (const char* relative : {"/RolvaneManager", "/../libexec/rolvane/RolvaneManager",
                                     "/../lib/rolvane/RolvaneManager", "/../../src/daemon/RolvaneManager"})
            places.push_back(here + relative);
    for (const std::string& place : places)
        if (::access(place.c_str(), X_OK) == 0) return std::filesystem::weakly_canonical(place).string();
    fail("The program RolvaneManager was not found. Install it, or name it in the environment variable "
         "ROLVANE_MANAGER.");
}

std::optional<pid_t> DaemonControl::running() const {
    return InstanceLock::holder(InstanceLock::defaultPath());
}

bool DaemonControl::managed() const {
    return _options.useServiceManager && !std::getenv("ROLVANE_MANAGER") &&
           runQuietly({"systemctl", "--user", "cat", kUnit}) == 0;
}

pid_t DaemonControl::spawn(const std::string& notifySocket, bool once) const {
    const std::string program = programPath();
    const Descriptor log(::open(logPath().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600));
    if (log.get() < 0) fail(fmt::format("The log file {} cannot be opened ({}).", logPath(), std::strerror(errno)));
    std::vector<std::string> environment;
    for (char** entry = environ; *entry; ++entry)
        if (std::strncmp(*entry, "NOTIFY_SOCKET=", 14) != 0) environment.emplace_back(*entry);
    if (!notifySocket.empty()) environment.push_back("NOTIFY_SOCKET=" + notifySocket);
    std::vector<char*> envp;
    for (std::string& e : environment) envp.push_back(e.data());
    envp.push_back(nullptr);

    std::string name = program, argument = "-p";
    char* const argv[] = {name.data(), once ? argument.data() : nullptr, nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attributes;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attributes);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, log.get(), 2);
    posix_spawn_file_actions_addchdir_np(&actions, "/");
    posix_spawnattr_setflags(&attributes, once ? 0 : POSIX_SPAWN_SETSID);
    pid_t pid = 0;
    const int error = ::posix_spawn(&pid, program.c_str(), &actions, &attributes, argv, envp.data());
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&actions);
    if (error != 0) fail(fmt::format("{} cannot be started ({}).", program, std::strerror(error)));
    return pid;
}

bool DaemonControl::start() const {
    if (running()) return false;
    if (managed()) {
        if (runQuietly({"systemctl", "--user", "start", kUnit}) != 0)
            fail(
                fmt::format("The service manager could not start {}. See `systemctl --user status {}`.", kUnit, kUnit));
        return true;
    }
    const NotifySocket notify;
    const pid_t pid = spawn(notify.path(), false);
    const Descriptor process = processDescriptor(pid);
    pollfd fds[2] = {{notify.get(), POLLIN, 0}, {process.get(), POLLIN, 0}};
    const auto end = std::chrono::steady_clock::now() + std::chrono::duration<double>(_options.startSeconds);
    for (;;) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
        if (left.count() <= 0)
            fail(fmt::format("RolvaneManager (process {}) did not check in within {} seconds. Its log is {}.", pid,
                             _options.startSeconds, logPath()));
        if (::poll(fds, 2, static_cast<int>(left.count())) < 0 && errno != EINTR) continue;
        if (fds[0].revents && notify.ready()) return true;
        if (fds[1].revents) {
            ::waitpid(pid, nullptr, 0);
            if (running()) return false; // somebody who started it at the same moment was faster
            fail(fmt::format("RolvaneManager ended at once. Its last words: {}", logTail(logPath(), 4096)));
        }
    }
}

bool DaemonControl::stop() const {
    const auto pid = running();
    if (!pid) return false;
    const Descriptor process = processDescriptor(*pid);
    if (managed()) runQuietly({"systemctl", "--user", "stop", kUnit});
    if (running() == pid && ::kill(*pid, SIGTERM) != 0 && errno != ESRCH)
        fail(fmt::format("RolvaneManager (process {}) cannot be told to end ({}).", *pid, std::strerror(errno)));
    ::kill(*pid, SIGCONT); // one that was stopped hears of nothing else
    if (process.get() >= 0 && !waitReadable(process.get(), _options.stopSeconds))
        fail(fmt::format("RolvaneManager (process {}) did not end within {} seconds. `kill -9 {}` ends it; nothing "
                         "that was saved is lost.",
                         *pid, _options.stopSeconds, *pid));
    ::waitpid(*pid, nullptr, WNOHANG); // when it was this process's own child
    return true;
}

void DaemonControl::restart() const {
    stop();
    start();
}

void DaemonControl::runOnce(double seconds) const {
    if (const auto pid = running())
        fail(fmt::format("RolvaneManager (process {}) runs already; it makes the pass.", *pid));
    const pid_t pid = spawn({}, true);
    const Descriptor process = processDescriptor(pid);
    if (!waitReadable(process.get(), seconds)) {
        ::kill(pid, SIGTERM);
        ::waitpid(pid, nullptr, 0);
        fail(fmt::format("The pass took longer than {} seconds and was stopped. What is left is kept for the next one.",
                         seconds));
    }
    int status = 0;
    ::waitpid(pid, &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0)
        fail(fmt::format("RolvaneManager ended abnormally. Its last words: {}", logTail(logPath(), 4096)));
}

} // namespace rolvane
