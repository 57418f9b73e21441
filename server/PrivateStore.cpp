#include "server/PrivateStore.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "server/LoopbackPort.h"
#include "server/PasswordFile.h"
#include "server/StoreCertificates.h"
#include "server/StoreConfiguration.h"
#include "server/StorePlaces.h"
#include "server/StoreProcess.h"

#include <cerrno>
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
constexpr int kFreshPortAttempts = 5;
constexpr size_t kLongestProcessNumber = 32;
constexpr size_t kLongestExplanation = 2000;

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXPrivateStoreException, reason);
}

bool exists(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

// httpd compares paths as texts: no section would apply below a symbolic link.
std::string withoutLinks(const std::string& path) {
    std::string clean = std::filesystem::weakly_canonical(std::filesystem::absolute(path)).string();
    while (clean.size() > 1 && clean.back() == '/') clean.pop_back();
    return clean;
}

std::string orDefault(const std::string& stateDirectory) {
    return withoutLinks(stateDirectory.empty() ? rolvane::stateDirectory() + "/store" : stateDirectory);
}

size_t sizeOf(const std::string& path) {
    struct stat info {};
    return lstat(path.c_str(), &info) == 0 ? static_cast<size_t>(info.st_size) : 0;
}

// Held by a launcher while it starts, stops or changes a store; one that comes second waits.
class LauncherLock {
public:
    explicit LauncherLock(const std::string& stateDirectory)
        : _file(open((stateDirectory + "/launcher.lock").c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600)) {
        while (_file && flock(_file.get(), LOCK_EX) != 0)
            if (errno != EINTR)
                fail("The store's directory " + stateDirectory + " cannot be locked: " + std::strerror(errno) + ".");
        if (!_file) fail("The store's directory " + stateDirectory + " cannot be used: " + std::strerror(errno) + ".");
    }

private:
    FileHandle _file; // closing it gives the lock back
};

// Reports when a file appears in a directory.
class DirectoryWatch {
public:
    explicit DirectoryWatch(const std::string& directory) : _events(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
        if (!_events ||
            inotify_add_watch(_events.get(), directory.c_str(), IN_CREATE | IN_MOVED_TO | IN_CLOSE_WRITE) < 0)
            fail("The store's directory " + directory + " cannot be watched: " + std::strerror(errno) + ".");
    }
    // Until something happened in the directory, the process ended, or the time ran out.
    void wait(const StoreProcess& process, std::chrono::milliseconds timeout) const {
        pollfd descriptors[] = {{_events.get(), POLLIN, 0}, {process.handle(), POLLIN, 0}};
        poll(descriptors, 2, static_cast<int>(std::max<long>(timeout.count(), 0)));
        char drained[4096];
        while (read(_events.get(), drained, sizeof drained) > 0) {
        }
    }

private:
    FileHandle _events;
};

} // namespace

struct PrivateStore::Implementation {
    PrivateStoreOptions options;
    std::string state;
    bool startedHere = false;

    explicit Implementation(PrivateStoreOptions given)
        : options(std::move(given)), state(orDefault(options.stateDirectory)) {
        if (options.documentRoot.empty()) options.documentRoot = state + "/root";
        options.documentRoot = withoutLinks(options.documentRoot);
        options.stateDirectory = state;
    }

    std::string configurationFile() const { return state + "/conf/httpd.conf"; }
    std::string pidFile() const { return state + "/run/httpd.pid"; }
    std::string settingsFile() const { return state + "/store.plist"; }
    std::string errorLog() const { return state + "/logs/error.log"; }
    std::string outputFile() const { return state + "/startup.log"; }
    std::string davDirectory() const { return options.documentRoot + "/dav"; }
    StoreCertificates certificates() const {
        return StoreCertificates(state + "/tls", StorePlaces::fileMode(StoreIdentity::choose()));
    }
    PasswordFile passwords() const {
        return PasswordFile(state + "/conf/passwords", state + "/conf/digests", kStoreRealm,
                            {.digests = options.authentication == StoreAuthentication::digest,
                             .cost = options.passwordCost,
                             .mode = StorePlaces::fileMode(StoreIdentity::choose())});
    }

    void makeDirectories() const;
    int savedPort() const;
    std::optional<StoreProcess> running() const;
    StoreIdentity identityFor() const;
    void checkProgram() const;
    void endOrphans() const;
    void saveSettings(int port) const;
    void checkDigests() const;
    void writeConfiguration(int port);
    void makeTrees(const StoreIdentity& identity) const;
    void startLocked();
    bool tryStart(int port, const StoreIdentity& identity, bool mayMove);
    void waitUntilReady(const StoreProcess& process, int port, size_t logStart) const;
    std::string explanation(size_t logStart) const;
    void stopLocked(Stop how);
    void usersChanged(bool wasRunning);
};

void PrivateStore::Implementation::makeDirectories() const {
    StorePlaces(state, options.documentRoot, StoreIdentity::choose()).make();
}

int PrivateStore::Implementation::savedPort() const {
    if (!exists(settingsFile())) return 0;
    return static_cast<int>(PropertyList::fromFile(settingsFile()).dictionary()["port"].integer());
}

std::optional<StoreProcess> PrivateStore::Implementation::running() const {
    const std::string text = textOfServersFile(pidFile(), kLongestProcessNumber);
    return StoreProcess::find(static_cast<pid_t>(std::atol(text.c_str())), configurationFile());
}

StoreIdentity PrivateStore::Implementation::identityFor() const {
    StoreIdentity identity = StoreIdentity::choose();
    if (!identity.change) return identity;
    identity.passFileModes = !identity.reaches(state) || !identity.reaches(davDirectory());
    return identity;
}

void PrivateStore::Implementation::checkProgram() const {
    if (access(options.httpdProgram.c_str(), X_OK) != 0)
        fail("The store needs Apache httpd, and there is no " + options.httpdProgram +
             ". Install the package apache2-bin (apt-get install apache2-bin) and start the store again.");
    for (const char* module : {"mod_mpm_event.so", "mod_dav.so", "mod_dav_fs.so"})
        if (!exists(options.httpdModules + "/" + module))
            fail("The store needs httpd's module " + std::string(module) + ", which is not in " + options.httpdModules +
                 ". Install the package apache2-bin again (apt-get install --reinstall apache2-bin).");
}

// A master that was killed leaves workers behind, which go on serving and hold the port.
void PrivateStore::Implementation::endOrphans() const {
    for (const auto& worker : StoreProcess::findAll(configurationFile())) {
        worker.signal(SIGKILL);
        worker.waitForExit(5s);
    }
}

void PrivateStore::Implementation::writeConfiguration(int port) {
    if (options.tls) certificates().ensure(options.hosts, options.certificateLifetime);
    const std::string form =
        readFile(options.configurationTemplate.empty() ? storeTemplatePath() : options.configurationTemplate);
    const mode_t mode = StorePlaces::fileMode(StoreIdentity::choose());
    writeFileDurably(configurationFile(), renderStoreConfiguration(form, options, port, LoopbackPort::hasIPv6()), mode);
    writeFileDurably(
        state + "/conf/users.conf",
        renderStoreUsers(davDirectory(), passwords().users(), options.authentication, options.keepsAccessLists()),
        mode);
    saveSettings(port);
}

void PrivateStore::Implementation::saveSettings(int port) const {
    writeFileDurably(settingsFile(), PropertyList::toXML(storeOptionsToDictionary(options, port)));
}

// The entries for Digest can be made when a password is given, and not from what is kept of it. They are as good as the
// passwords: a store that does not ask for them keeps none.
void PrivateStore::Implementation::checkDigests() const {
    if (options.authentication != StoreAuthentication::digest) return passwords().dropDigests();
    std::string names;
    for (const std::string& user : passwords().usersWithoutDigest()) names += (names.empty() ? "" : ", ") + user;
    if (names.empty()) return;
    saveSettings(savedPort());
    fail("The store is to use Digest from now on, and has no password in that form for: " + names +
         ". Give each of them a password again (rolvane store user add NAME), then start the store.");
}

void PrivateStore::Implementation::makeTrees(const StoreIdentity& identity) const {
    const StorePlaces places(state, options.documentRoot, identity);
    for (const auto& user : passwords().users()) places.makeForUser(user);
}

void PrivateStore::Implementation::startLocked() {
    if (running()) return;
    checkProgram();
    checkDigests();
    endOrphans();
    const StoreIdentity identity = identityFor();
    int port = options.port ? options.port : savedPort();
    const bool fresh = port == 0;
    if (!fresh && !LoopbackPort::isFree(port))
        fail("The store's port " + std::to_string(port) +
             " is taken by another program. Stop that program, or choose another port with --port (published lists are "
             "known by their port, so subscribers have to be told).");
    for (int attempt = 1;; ++attempt) {
        if (fresh) port = LoopbackPort::choose();
        if (tryStart(port, identity, fresh && attempt < kFreshPortAttempts)) return;
    }
}

// False when the port was taken in the meantime and another one may be tried.
bool PrivateStore::Implementation::tryStart(int port, const StoreIdentity& identity, bool mayMove) {
    writeConfiguration(port);
    unlink(pidFile().c_str());
    makeTrees(identity);
    const size_t logStart = sizeOf(errorLog());
    const StoreProcess process =
        StoreProcess::launch({options.httpdProgram, "-d", state, "-f", configurationFile(), "-DFOREGROUND"}, identity,
                             outputFile(), options.environment);
    try {
        waitUntilReady(process, port, logStart);
    } catch (const CXException&) {
        process.signal(SIGKILL);
        process.waitForExit(5s);
        endOrphans();
        if (mayMove && !LoopbackPort::isFree(port)) return false;
        throw;
    }
    startedHere = true;
    return true;
}

// httpd writes its pid file when it listens, and answers when a worker has come up.
void PrivateStore::Implementation::waitUntilReady(const StoreProcess& process, int port, size_t logStart) const {
    const DirectoryWatch watch(state + "/run");
    const auto deadline = std::chrono::steady_clock::now() + kStartDeadline;
    while (textOfServersFile(pidFile(), kLongestProcessNumber).empty()) {
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (process.hasExited()) fail("The store's httpd did not start. " + explanation(logStart));
        if (left <= 0ms) fail("The store's httpd did not listen within 10 seconds. " + explanation(logStart));
        watch.wait(process, left);
    }
    if (!LoopbackPort::answers(port, options.tls, kStartDeadline) || process.hasExited())
        fail("The store's httpd listens, but does not answer. " + explanation(logStart));
}

std::string PrivateStore::Implementation::explanation(size_t logStart) const {
    const size_t logged = sizeOf(errorLog());
    std::string said = textOfServersFile(outputFile(), kLongestExplanation) +
                       textOfServersFile(errorLog(), logged > logStart ? logged - logStart : 0);
    if (said.size() > kLongestExplanation) said = "..." + said.substr(said.size() - kLongestExplanation);
    return said.empty() ? "It said nothing; its log is " + errorLog() + "." : "It said:\n" + said;
}

void PrivateStore::Implementation::stopLocked(Stop how) {
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
            fail("The store's httpd (process " + std::to_string(process->pid()) +
                 ") does not end. Look at what it waits for, for instance a file system that does not answer.");
    }
    unlink(pidFile().c_str());
}

// httpd reads the passwords at every request, and the access lists ask for no more than a name. Only a store without
// lists has a section of its configuration for each user.
void PrivateStore::Implementation::usersChanged(bool wasRunning) {
    const auto started = savedOptions(state);
    if (!wasRunning || (started && started->keepsAccessLists())) return;
    stopLocked(Stop::atOnce);
    startLocked();
}

PrivateStore::PrivateStore(PrivateStoreOptions options)
    : _implementation(std::make_unique<Implementation>(std::move(options))) {}

PrivateStore::PrivateStore(PrivateStore&&) noexcept = default;

PrivateStore::~PrivateStore() {
    if (!_implementation || !_implementation->options.ownsProcess || !_implementation->startedHere) return;
    try {
        stop(Stop::atOnce);
    } catch (const CXException&) {
        // A destructor has nobody to tell; the store is still there for `stop`.
    }
}

std::optional<PrivateStoreOptions> PrivateStore::savedOptions(const std::string& stateDirectory) {
    const std::string state = orDefault(stateDirectory);
    if (!exists(state + "/store.plist")) return std::nullopt;
    PrivateStoreOptions options =
        storeOptionsFromDictionary(PropertyList::fromFile(state + "/store.plist").dictionary());
    options.stateDirectory = state;
    return options;
}

void PrivateStore::start() {
    _implementation->makeDirectories();
    const LauncherLock lock(_implementation->state);
    _implementation->startLocked();
}

void PrivateStore::stop(Stop how) {
    if (!exists(_implementation->settingsFile())) return;
    _implementation->makeDirectories();
    const LauncherLock lock(_implementation->state);
    _implementation->stopLocked(how);
}

PrivateStoreStatus PrivateStore::status() const {
    PrivateStoreStatus status;
    if (const auto process = _implementation->running()) {
        status.running = true;
        status.pid = process->pid();
    }
    status.port = _implementation->savedPort();
    return status;
}

void PrivateStore::addUser(const std::string& user, const std::string& password) {
    if (!PasswordFile::isValidUser(user))
        fail("\"" + user +
             "\" cannot be a user of the store: use up to 64 letters, digits and . _ - @ +, and begin with "
             "a letter, a digit or _.");
    if (password.empty() || password.find_first_of(std::string("\n\r\0", 3)) != std::string::npos)
        fail("The password of " + user + " must not be empty or hold a line break. Choose another one.");
    if (password.size() > PasswordFile::kLongestPassword)
        fail("The password of " + user + " is longer than " + std::to_string(PasswordFile::kLongestPassword) +
             " bytes, and what comes after them would not count. Choose a shorter one.");
    _implementation->makeDirectories();
    const LauncherLock lock(_implementation->state);
    const bool known = _implementation->passwords().contains(user);
    _implementation->passwords().set(user, password);
    _implementation->makeTrees(_implementation->identityFor());
    if (!known) _implementation->usersChanged(_implementation->running().has_value());
}

bool PrivateStore::removeUser(const std::string& user) {
    _implementation->makeDirectories();
    const LauncherLock lock(_implementation->state);
    if (!_implementation->passwords().remove(user)) return false;
    _implementation->usersChanged(_implementation->running().has_value());
    return true;
}

std::vector<std::string> PrivateStore::users() const {
    return _implementation->passwords().users();
}

std::string PrivateStore::stateDirectory() const {
    return _implementation->state;
}
std::string PrivateStore::documentRoot() const {
    return _implementation->options.documentRoot;
}
std::string PrivateStore::userDirectory(const std::string& user) const {
    return _implementation->davDirectory() + "/" + user;
}
std::string PrivateStore::caFile() const {
    return _implementation->certificates().caFile();
}
std::string PrivateStore::errorLog() const {
    return _implementation->errorLog();
}

std::string PrivateStore::baseURL() const {
    const int port = _implementation->savedPort();
    if (port == 0)
        fail("The store in " + stateDirectory() + " has never been started. Start it with: rolvane store start");
    return (_implementation->options.tls ? "https" : "http") + std::string("://localhost:") + std::to_string(port) +
           "/dav";
}

std::string PrivateStore::endpointTemplate() const {
    return baseURL() + "/{user}/Contacts";
}

} // namespace rolvane
