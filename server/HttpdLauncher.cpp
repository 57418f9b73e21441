#include "server/HttpdLauncher.h"

#include "foundation/CXException.h"
#include "server/LoopbackPort.h"
#include "server/PrivateStore.h"
#include "server/StorePlaces.h"

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <poll.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

using namespace std::chrono_literals;

constexpr auto kStartDeadline = 10s;
constexpr std::chrono::milliseconds kLookInterval = 20ms; // where nothing tells of files
constexpr size_t kLongestProcessNumber = 32;
constexpr size_t kLongestExplanation = 2000;

size_t sizeOf(const std::string& path) {
    struct stat info {};
    return lstat(path.c_str(), &info) == 0 ? static_cast<size_t>(info.st_size) : 0;
}

// Reports when a file may have appeared in a directory.
class DirectoryWatch {
public:
    explicit DirectoryWatch(const std::string& directory) : _events(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
        if (_events &&
            inotify_add_watch(_events.get(), directory.c_str(), IN_CREATE | IN_MOVED_TO | IN_CLOSE_WRITE) < 0)
            _events = FileHandle();
    }
    // Until something happened in the directory, the process ended, or the time ran out. A user has a number of watches
    // and no more; without one it is time to look again soon.
    void wait(const StoreProcess& process, std::chrono::milliseconds timeout) const {
        if (!_events) timeout = std::min(timeout, kLookInterval);
        pollfd descriptors[] = {{process.handle(), POLLIN, 0}, {_events.get(), POLLIN, 0}};
        poll(descriptors, _events ? 2 : 1, static_cast<int>(std::max<long>(timeout.count(), 0)));
        if (!_events) return;
        char drained[4096];
        while (read(_events.get(), drained, sizeof drained) > 0) {
        }
    }

private:
    FileHandle _events;
};

} // namespace

std::string HttpdLauncher::withoutLinks(const std::string& path) {
    std::string clean = std::filesystem::weakly_canonical(std::filesystem::absolute(path)).string();
    while (clean.size() > 1 && clean.back() == '/') clean.pop_back();
    return clean;
}

void HttpdLauncher::fail(const std::string& reason) const {
    throw CXException(kCXPrivateStoreException, _service.name + reason);
}

FileHandle HttpdLauncher::lock() const {
    const std::string& state = _service.stateDirectory;
    FileHandle file(open((state + "/launcher.lock").c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600));
    while (file && flock(file.get(), LOCK_EX) != 0)
        if (errno != EINTR) fail("'s directory " + state + " cannot be locked: " + std::strerror(errno) + ".");
    if (!file) fail("'s directory " + state + " cannot be used: " + std::strerror(errno) + ".");
    return file;
}

std::optional<StoreProcess> HttpdLauncher::running() const {
    const std::string text = textOfServersFile(pidFile(), kLongestProcessNumber);
    return StoreProcess::find(static_cast<pid_t>(std::atol(text.c_str())), configurationFile());
}

void HttpdLauncher::checkProgram(const std::vector<std::string>& neededModules) const {
    if (access(_service.program.c_str(), X_OK) != 0)
        fail(" needs Apache httpd, and there is no " + _service.program +
             ". Install the package apache2-bin (apt-get install apache2-bin) and start it again.");
    for (const std::string& module : neededModules)
        if (access((_service.modules + "/" + module).c_str(), F_OK) != 0)
            fail(" needs httpd's module " + module + ", which is not in " + _service.modules +
                 ". Install the package apache2-bin again (apt-get install --reinstall apache2-bin).");
}

void HttpdLauncher::endOrphans() const {
    for (const auto& worker : StoreProcess::findAll(configurationFile())) {
        worker.signal(SIGKILL);
        worker.waitForExit(5s);
    }
}

void HttpdLauncher::launch(const StoreIdentity& identity, int port, bool tls,
                           const std::vector<std::string>& environment) const {
    unlink(pidFile().c_str());
    const size_t logStart = sizeOf(errorLog());
    const StoreProcess process = StoreProcess::launch(
        {_service.program, "-d", _service.stateDirectory, "-f", configurationFile(), "-DFOREGROUND"}, identity,
        outputFile(), environment);
    try {
        waitUntilReady(process, port, tls, logStart);
    } catch (const CXException&) {
        process.signal(SIGKILL);
        process.waitForExit(5s);
        endOrphans();
        throw;
    }
}

std::string HttpdLauncher::complaint(const StoreIdentity& identity) const {
    const std::string output = _service.stateDirectory + "/check.log";
    const StoreProcess process = StoreProcess::launch(
        {_service.program, "-d", _service.stateDirectory, "-f", configurationFile(), "-t"}, identity, output);
    const bool ended = process.waitForExit(kStartDeadline);
    if (!ended) process.signal(SIGKILL);
    std::string said = textOfServersFile(output, kLongestExplanation);
    if (ended && said.find("Syntax OK") != std::string::npos) said.clear();
    unlink(output.c_str());
    return said.empty() && !ended ? "It did not look at its configuration within 10 seconds." : said;
}

// httpd writes its pid file when it listens, and answers when a worker has come up.
void HttpdLauncher::waitUntilReady(const StoreProcess& process, int port, bool tls, size_t logStart) const {
    const DirectoryWatch watch(_service.stateDirectory + "/run");
    const auto deadline = std::chrono::steady_clock::now() + kStartDeadline;
    while (textOfServersFile(pidFile(), kLongestProcessNumber).empty()) {
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (process.hasExited()) fail("'s httpd did not start. " + explanation(logStart));
        if (left <= 0ms) fail("'s httpd did not listen within 10 seconds. " + explanation(logStart));
        watch.wait(process, left);
    }
    if (!LoopbackPort::answers(port, tls, kStartDeadline) || process.hasExited())
        fail("'s httpd listens, but does not answer. " + explanation(logStart));
}

std::string HttpdLauncher::explanation(size_t logStart) const {
    const size_t logged = sizeOf(errorLog());
    std::string said = textOfServersFile(outputFile(), kLongestExplanation) +
                       textOfServersFile(errorLog(), logged > logStart ? logged - logStart : 0);
    if (said.size() > kLongestExplanation) said = "..." + said.substr(said.size() - kLongestExplanation);
    return said.empty() ? "It said nothing; its log is " + errorLog() + "." : "It said:\n" + said;
}

void HttpdLauncher::stop(Stop how) const {
    const auto process = running();
    if (!process) {
        endOrphans();
        unlink(pidFile().c_str());
        return;
    }
    if (how == Stop::gracefully) {
        process->signal(SIGWINCH);
        process->waitForExit(5s);
    }
    if (!process->hasExited()) {
        process->signal(SIGTERM);
        process->waitForExit(5s);
    }
    if (!process->hasExited()) {
        kill(-process->pid(), SIGKILL); // its session's whole group
        if (!process->waitForExit(5s))
            fail("'s httpd (process " + std::to_string(process->pid()) +
                 ") does not end. Look at what it waits for, for instance a file system that does not answer.");
    }
    unlink(pidFile().c_str());
}

} // namespace rolvane
