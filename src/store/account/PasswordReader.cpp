#include "store/account/PasswordReader.h"

#include "foundation/CXException.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace rolvane {

namespace {

constexpr size_t kMaxBytes = 4096;
constexpr int kCommandSeconds = 10;

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXNetworkException, reason);
}

struct Descriptor {
    int fd = -1;
    ~Descriptor() {
        if (fd >= 0) close(fd);
    }
};

std::string firstLine(const std::string& text) {
    return text.substr(0, text.find_first_of("\r\n"));
}

std::string fromFile(const std::string& path, bool checkMode) {
    Descriptor file{open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY)};
    struct stat st;
    if (file.fd < 0 || fstat(file.fd, &st) != 0)
        fail("The password file " + path + " cannot be read: " + strerror(errno) + ".");
    if (checkMode && (st.st_mode & 077) != 0)
        fail("The password file " + path + " can be read by others. Run: chmod 600 " + path);
    char buffer[kMaxBytes];
    const ssize_t n = read(file.fd, buffer, sizeof buffer);
    if (n < 0) fail("The password file " + path + " cannot be read: " + strerror(errno) + ".");
    const std::string password = firstLine({buffer, static_cast<size_t>(n)});
    if (password.empty()) fail("The password file " + path + " is empty.");
    return password;
}

std::string fromCredential(const std::string& name) {
    if (name.find('/') != std::string::npos) fail("\"" + name + "\" cannot be the name of a credential.");
    const char* directory = getenv("CREDENTIALS_DIRECTORY");
    if (!directory || !*directory)
        fail("The service manager gave no credentials, so the password \"" + name +
             "\" is not known. Add LoadCredential= to the service's unit.");
    return fromFile(std::string(directory) + "/" + name, false);
}

// Reads until the end or the limit; false when the time ran out.
bool readAll(int fd, std::string& out) {
    using namespace std::chrono;
    const auto deadline = steady_clock::now() + seconds(kCommandSeconds);
    while (out.size() < kMaxBytes) {
        const auto left = duration_cast<milliseconds>(deadline - steady_clock::now()).count();
        pollfd p{fd, POLLIN, 0};
        const int ready = left <= 0 ? 0 : poll(&p, 1, static_cast<int>(left));
        if (ready < 0 && errno == EINTR) continue;
        if (ready <= 0) return false;
        char buffer[512];
        const ssize_t n = read(fd, buffer, sizeof buffer);
        if (n <= 0) return true;
        out.append(buffer, static_cast<size_t>(n));
        if (out.find('\n') != std::string::npos) return true;
    }
    return true;
}

// Waits for the child, at most two seconds when it may go on at all, then ends it.
int ended(pid_t child, bool mayGoOn) {
    int status = 0;
    for (int i = 0; mayGoOn && i < 200; ++i) {
        if (waitpid(child, &status, WNOHANG) == child) return status;
        usleep(10000);
    }
    kill(child, SIGKILL);
    waitpid(child, &status, 0);
    return status;
}

std::string fromCommand(const std::string& command) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) fail(std::string("No pipe for the password command: ") + strerror(errno) + ".");
    Descriptor readEnd{ends[0]};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, ends[1], 1);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    const char* arguments[] = {"/bin/sh", "-c", command.c_str(), nullptr};
    pid_t child = 0;
    // The daemon's threads block signals, and what is blocked is inherited, by whatever the command starts, too.
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    sigset_t none;
    sigemptyset(&none);
    posix_spawnattr_setsigmask(&attributes, &none);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK);
    const int error = posix_spawn(&child, "/bin/sh", &actions, &attributes, const_cast<char**>(arguments), environ);
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&actions);
    close(ends[1]);
    if (error != 0) fail(std::string("The password command cannot be started: ") + strerror(error) + ".");
    std::string output;
    const bool inTime = readAll(readEnd.fd, output);
    const int status = ended(child, inTime);
    if (!inTime) fail("The password command gave no answer within " + std::to_string(kCommandSeconds) + " seconds.");
    const std::string password = firstLine(output);
    if (password.empty())
        fail("The password command gave no password (exit code " +
             std::to_string(WIFEXITED(status) ? WEXITSTATUS(status) : -1) + "). Try it in a shell.");
    return password;
}

} // namespace

std::string readPassword(const PasswordSource& source) {
    switch (source.kind) {
    case PasswordSource::Kind::none: return {};
    case PasswordSource::Kind::command: return fromCommand(source.value);
    case PasswordSource::Kind::credential: return fromCredential(source.value);
    case PasswordSource::Kind::file: return fromFile(source.value, true);
    }
    return {};
}

} // namespace rolvane
