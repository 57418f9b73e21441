#include "server/StoreProcess.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <grp.h>
#include <linux/capability.h>
#include <poll.h>
#include <pwd.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane {

namespace {

[[noreturn]] void fail(const std::string& reason) {
    throw CXException("CXPrivateStoreException", reason);
}

// What follows runs between fork and exec: system calls only.

bool inBoundingSet(int capability) {
    return prctl(PR_CAPBSET_READ, capability, 0, 0, 0) == 1;
}

bool keepCapability(int capability) {
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2] = {};
    data[0].effective = data[0].permitted = data[0].inheritable = 1u << capability;
    return syscall(SYS_capset, &header, data) == 0 &&
           prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_RAISE, capability, 0, 0) == 0;
}

bool becomeIdentity(const StoreIdentity& identity) {
    if (!identity.change) return true;
    if (identity.passFileModes && prctl(PR_SET_KEEPCAPS, 1, 0, 0, 0) != 0) return false;
    if (setgroups(0, nullptr) != 0 || setresgid(identity.gid, identity.gid, identity.gid) != 0 ||
        setresuid(identity.uid, identity.uid, identity.uid) != 0)
        return false;
    if (!identity.passFileModes) return true;
    // Containers often withhold the narrower right.
    const bool readOnly = !identity.changeFiles && inBoundingSet(CAP_DAC_READ_SEARCH);
    return keepCapability(readOnly ? CAP_DAC_READ_SEARCH : CAP_DAC_OVERRIDE);
}

// A connection is a descriptor, and a session's usual limit is a thousand of them.
void allowDescriptors() {
    constexpr rlim_t kEnough = 16384;
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= kEnough) return;
    limit.rlim_cur = std::min(limit.rlim_max, kEnough);
    setrlimit(RLIMIT_NOFILE, &limit);
}

// Requests carry passwords, and so would a core file.
void forbidCoreFiles() {
    const rlimit none{0, 0};
    setrlimit(RLIMIT_CORE, &none);
}

[[noreturn]] void runChild(char* const* arguments, char* const* environment, const StoreIdentity& identity, int output,
                           int report) {
    setsid();
    forbidCoreFiles();
    umask(0077);
    allowDescriptors();
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    for (int number : {SIGPIPE, SIGHUP, SIGINT, SIGTERM, SIGCHLD, SIGUSR1}) ::signal(number, SIG_DFL);
    const int null = open("/dev/null", O_RDONLY);
    dup2(null, 0);
    dup2(output, 1);
    dup2(output, 2);
    dup2(report, 3);
    close_range(4, ~0u, 0);
    fcntl(3, F_SETFD, FD_CLOEXEC);
    if (becomeIdentity(identity) && chdir("/") == 0) execve(arguments[0], arguments, environment);
    const int error = errno;
    [[maybe_unused]] const ssize_t written = write(3, &error, sizeof error);
    _exit(127);
}

FileHandle pidHandle(pid_t pid) {
    return FileHandle(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
}

// Empty of a process that is gone; it may go while it is read.
std::string commandLine(pid_t pid) {
    try {
        return readFile("/proc/" + std::to_string(pid) + "/cmdline");
    } catch (const CXException&) {
        return {};
    }
}

// As httpd is started, with zero bytes between. An editor, or a pager, names the file alone.
std::string argumentsOfHttpd(const std::string& configurationFile) {
    const std::string state = std::filesystem::path(configurationFile).parent_path().parent_path().string();
    std::string text;
    for (const std::string& argument : {std::string(), std::string("-d"), state, std::string("-f"), configurationFile})
        text += argument + '\0';
    return text;
}

} // namespace

FileHandle::~FileHandle() {
    if (_fd >= 0) close(_fd);
}

StoreIdentity StoreIdentity::choose() {
    StoreIdentity identity;
    identity.uid = geteuid();
    identity.gid = getegid();
    if (identity.uid != 0) return identity;
    for (const char* name : {"www-data", "nobody"}) {
        passwd entry{};
        passwd* found = nullptr;
        std::array<char, 16384> texts{}; // glibc's own bound for an entry is 1024
        if (getpwnam_r(name, &entry, texts.data(), texts.size(), &found) == 0 && found) {
            identity.change = true;
            identity.uid = found->pw_uid;
            identity.gid = found->pw_gid;
            identity.name = name;
            return identity;
        }
    }
    fail(
        "The store's httpd does not run as root, and there is neither a user www-data nor nobody to run it as. Add one "
        "of them, or start the store as an ordinary user.");
}

StoreIdentity StoreIdentity::named(const std::string& user) {
    passwd entry{};
    passwd* found = nullptr;
    std::array<char, 16384> texts{};
    if (getpwnam_r(user.c_str(), &entry, texts.data(), texts.size(), &found) != 0 || !found)
        fail("This machine has no user " + user + ". The package rolvane-store makes it.");
    StoreIdentity identity;
    identity.change = true;
    identity.uid = found->pw_uid;
    identity.gid = found->pw_gid;
    identity.name = user;
    return identity;
}

void StoreIdentity::takeOn(bool ports) const {
    prctl(PR_SET_KEEPCAPS, 1, 0, 0, 0);
    if (initgroups(name.c_str(), gid) != 0 || setresgid(gid, gid, gid) != 0 || setresuid(uid, uid, uid) != 0)
        fail("The user " + name + " cannot be taken on: " + std::strerror(errno) + ".");
    // Where a container withholds it, httpd says that it may not listen there.
    if (!ports || !inBoundingSet(CAP_NET_BIND_SERVICE) || !keepCapability(CAP_NET_BIND_SERVICE)) {
        __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
        __user_cap_data_struct none[2] = {};
        if (syscall(SYS_capset, &header, none) != 0) fail("The rights of root cannot be given up.");
    }
}

bool StoreIdentity::reaches(const std::string& path) const {
    if (!change) return true;
    const auto searchable = [&](const std::filesystem::path& directory) {
        struct stat info;
        if (stat(directory.c_str(), &info) != 0) return false;
        if (info.st_uid == uid) return (info.st_mode & S_IXUSR) != 0;
        if (info.st_gid == gid) return (info.st_mode & S_IXGRP) != 0;
        return (info.st_mode & S_IXOTH) != 0;
    };
    std::filesystem::path here;
    for (const auto& component : std::filesystem::path(path)) {
        here /= component;
        if (!searchable(here)) return false;
    }
    return true;
}

int StoreIdentity::run(const std::function<int()>& action) const {
    constexpr int kNotThatUser = 255;
    const pid_t pid = fork();
    if (pid < 0) fail(std::string("The store's user cannot be taken on: ") + std::strerror(errno) + ".");
    if (pid == 0) _exit(becomeIdentity(*this) ? action() : kNotThatUser);
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    const int result = WIFEXITED(status) ? WEXITSTATUS(status) : kNotThatUser;
    if (result == kNotThatUser) fail("The store's user " + name + " cannot be taken on by this process.");
    return result;
}

std::optional<StoreProcess> StoreProcess::find(pid_t pid, const std::string& configurationFile) {
    if (pid <= 0) return std::nullopt;
    FileHandle handle = pidHandle(pid);
    if (!handle) return std::nullopt;
    // Opened first, read then: the number cannot change hands between the two without the handle becoming readable.
    const std::string line = commandLine(pid);
    StoreProcess process(pid, std::move(handle));
    if (line.find(argumentsOfHttpd(configurationFile)) == std::string::npos || process.hasExited()) return std::nullopt;
    return process;
}

std::vector<StoreProcess> StoreProcess::findAll(const std::string& configurationFile) {
    std::vector<StoreProcess> all;
    for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
        const pid_t pid = static_cast<pid_t>(std::atol(entry.path().filename().c_str()));
        if (auto process = find(pid, configurationFile)) all.push_back(std::move(*process));
    }
    return all;
}

StoreProcess StoreProcess::launch(const std::vector<std::string>& command, const StoreIdentity& identity,
                                  const std::string& outputFile, std::vector<std::string> environment) {
    // A new file, whatever was there: its old one may have another name somewhere else.
    unlink(outputFile.c_str());
    FileHandle output(open(outputFile.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (!output) fail("The store's file " + outputFile + " cannot be written: " + std::strerror(errno) + ".");
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) fail(std::string("The store cannot be started: ") + std::strerror(errno) + ".");
    FileHandle reading(ends[0]), writing(ends[1]);
    // Out of the way of the child's standard descriptors, whatever of them this process has closed.
    output = FileHandle(fcntl(output.get(), F_DUPFD_CLOEXEC, 10));
    writing = FileHandle(fcntl(writing.get(), F_DUPFD_CLOEXEC, 10));

    std::vector<char*> arguments;
    for (const auto& argument : command) arguments.push_back(const_cast<char*>(argument.c_str()));
    arguments.push_back(nullptr);
    environment.insert(environment.begin(), {"PATH=/usr/local/bin:/usr/bin:/bin", "LANG=C"});
    if (const char* zone = getenv("TZ")) environment.push_back(std::string("TZ=") + zone); // of the logs
    std::vector<char*> variables;
    for (auto& variable : environment) variables.push_back(variable.data());
    variables.push_back(nullptr);

    const pid_t pid = fork();
    if (pid < 0) fail(std::string("The store cannot be started: ") + std::strerror(errno) + ".");
    if (pid == 0) runChild(arguments.data(), variables.data(), identity, output.get(), writing.get());

    writing = FileHandle();
    int error = 0;
    ssize_t got;
    while ((got = read(reading.get(), &error, sizeof error)) < 0 && errno == EINTR) {
    }
    if (got == sizeof error) {
        waitpid(pid, nullptr, 0);
        fail("The store's program " + command.front() + " cannot be run" +
             (identity.change ? " as the user " + identity.name : std::string()) + ": " + std::strerror(error) + ".");
    }
    return StoreProcess(pid, pidHandle(pid));
}

bool StoreProcess::waitForExit(std::chrono::milliseconds timeout) const {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        pollfd descriptor{_handle.get(), POLLIN, 0};
        const int ready = poll(&descriptor, 1, static_cast<int>(std::max<long>(left.count(), 0)));
        if (ready < 0 && errno == EINTR) continue;
        if (ready > 0) waitpid(_pid, nullptr, WNOHANG); // when it is ours
        return ready > 0;
    }
}

void StoreProcess::signal(int number) const {
    syscall(SYS_pidfd_send_signal, _handle.get(), number, nullptr, 0);
}

} // namespace rolvane
