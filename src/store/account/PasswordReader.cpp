#include "store/account/PasswordReader.h"

#include "foundation/CXException.h"
#include "store/account/SecretService.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <string_view>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

extern char** environ; // NOLINT: POSIX declares it nowhere

namespace rolvane {

namespace {

constexpr size_t kMaxBytes = 4096;
constexpr int kCommandSeconds = 10;

// Variables that are this process's own affair, or that make the command's shell or its programs run something else.
// Everything else stays: a password manager finds its session, agent and display there.
constexpr std::string_view kNotForCommands[] = {
    "LD_",       "GCONV_PATH=", "GLIBC_TUNABLES=", "NOTIFY_SOCKET=", "LISTEN_", "WATCHDOG_", "ENV=",
    "BASH_ENV=", "BASH_FUNC_",  "SHELLOPTS=",      "BASHOPTS=",      "IFS=",    "CDPATH=",   "PS4="};

// The directories of a path that mean the same wherever the command runs.
std::string absolutePath(std::string_view path) {
    std::string out;
    while (!path.empty()) {
        const size_t end = std::min(path.find(':'), path.size());
        if (path[0] == '/') out += (out.empty() ? "" : ":") + std::string(path.substr(0, end));
        path.remove_prefix(std::min(end + 1, path.size()));
    }
    return out.empty() ? "/usr/local/bin:/usr/bin:/bin" : out;
}

std::vector<std::string> environmentOfCommands() {
    std::vector<std::string> all;
    for (char** each = environ; *each; ++each) {
        const std::string_view variable = *each;
        if (std::any_of(std::begin(kNotForCommands), std::end(kNotForCommands),
                        [&](std::string_view name) { return variable.starts_with(name); }))
            continue;
        if (constexpr std::string_view kPath = "PATH="; variable.starts_with(kPath))
            all.push_back(std::string(kPath) + absolutePath(variable.substr(kPath.size())));
        else
            all.emplace_back(variable);
    }
    return all;
}

// The caller keeps the password, and so does libcurl, which sends it. A core file of this process would hold it.
void keepOutOfCoreFiles() {
    prctl(PR_SET_DUMPABLE, 0, 0, 0, 0);
}

void clear(std::string& text) {
    explicit_bzero(text.data(), text.size());
}

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
    std::string text(buffer, static_cast<size_t>(n));
    const std::string password = firstLine(text);
    clear(text);
    explicit_bzero(buffer, sizeof buffer);
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
        explicit_bzero(buffer, sizeof buffer);
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
    std::vector<std::string> environment = environmentOfCommands();
    std::vector<char*> variables;
    for (std::string& variable : environment) variables.push_back(variable.data());
    variables.push_back(nullptr);
    const int error =
        posix_spawn(&child, "/bin/sh", &actions, &attributes, const_cast<char**>(arguments), variables.data());
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&actions);
    close(ends[1]);
    if (error != 0) fail(std::string("The password command cannot be started: ") + strerror(error) + ".");
    std::string output;
    output.reserve(kMaxBytes + 512); // grows no copies
    const bool inTime = readAll(readEnd.fd, output);
    const int status = ended(child, inTime);
    if (!inTime) fail("The password command gave no answer within " + std::to_string(kCommandSeconds) + " seconds.");
    const std::string password = firstLine(output);
    clear(output);
    if (password.empty())
        fail("The password command gave no password (exit code " +
             std::to_string(WIFEXITED(status) ? WEXITSTATUS(status) : -1) + "). Try it in a shell.");
    return password;
}

} // namespace

std::string readPassword(const PasswordSource& source) {
    if (source.kind != PasswordSource::Kind::none) keepOutOfCoreFiles();
    switch (source.kind) {
    case PasswordSource::Kind::none: return {};
    case PasswordSource::Kind::command: return fromCommand(source.value);
    case PasswordSource::Kind::credential: return fromCredential(source.value);
    case PasswordSource::Kind::file: return fromFile(source.value, true);
    case PasswordSource::Kind::keyring: return secretFromService(source.value);
    }
    return {};
}

} // namespace rolvane
