#include "server/PrivateStore.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "foundation/Url.h"
#include "server/HttpdLauncher.h"
#include "server/LoopbackPort.h"
#include "server/PasswordFile.h"
#include "server/StoreCertificates.h"
#include "server/StoreConfiguration.h"
#include "server/StorePlaces.h"
#include "server/StoreProcess.h"

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <sstream>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int kFreshPortAttempts = 5;

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXPrivateStoreException, reason);
}

bool exists(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

std::string orDefault(const std::string& stateDirectory) {
    return HttpdLauncher::withoutLinks(stateDirectory.empty() ? rolvane::stateDirectory() + "/store" : stateDirectory);
}

} // namespace

struct PrivateStore::Implementation {
    PrivateStoreOptions options;
    std::string state;
    bool startedHere = false;

    explicit Implementation(PrivateStoreOptions given)
        : options(std::move(given)), state(orDefault(options.stateDirectory)) {
        if (options.documentRoot.empty()) options.documentRoot = state + "/root";
        options.documentRoot = HttpdLauncher::withoutLinks(options.documentRoot);
        options.stateDirectory = state;
    }

    HttpdLauncher launcher() const {
        return HttpdLauncher({"The store", state, options.httpdProgram, options.httpdModules});
    }
    std::string settingsFile() const { return state + "/store.plist"; }
    std::string quotasFile() const { return state + "/conf/quotas"; }
    std::map<std::string, std::string> quotas() const;
    std::string shownCertificate() const;
    std::string urlBy(const std::string& host) const;
    void checkCertificate() const;
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
    StoreIdentity identityFor() const;
    void saveSettings(int port) const;
    void checkDigests() const;
    void writeConfiguration(int port);
    void makeTrees(const StoreIdentity& identity) const;
    void startLocked();
    bool tryStart(int port, const StoreIdentity& identity, bool mayMove);
    void usersChanged(bool wasRunning);
};

std::map<std::string, std::string> PrivateStore::Implementation::quotas() const {
    std::map<std::string, std::string> all;
    if (!exists(quotasFile())) return all;
    std::istringstream lines(readFile(quotasFile()));
    for (std::string line; std::getline(lines, line);)
        if (const size_t colon = line.find(": "); colon != std::string::npos)
            all[line.substr(0, colon)] = line.substr(colon + 2);
    return all;
}

std::string PrivateStore::Implementation::shownCertificate() const {
    if (!options.certificate.empty()) return options.certificate;
    if (options.acmeDirectory.empty()) return certificates().certificateFile();
    const std::string fetched = state + "/md/domains/" + options.name + "/pubcert.pem";
    return exists(fetched) ? fetched : "";
}

std::string PrivateStore::Implementation::urlBy(const std::string& host) const {
    const int port = savedPort();
    if (port == 0) fail("The store in " + state + " has never been started. Start it with: rolvane store start");
    const bool isUsual = options.tls && port == 443;
    return (options.tls ? "https://" : "http://") + host + (isUsual ? "" : ":" + std::to_string(port)) + "/dav";
}

void PrivateStore::Implementation::checkCertificate() const {
    if (options.certificate.empty()) return;
    const std::string problem = certificateProblem(options.certificate, options.certificateKey);
    if (!problem.empty())
        fail(problem + " The store's user has to be able to read both files. Mend that, and start the store again.");
}

void PrivateStore::Implementation::makeDirectories() const {
    if (!options.acmeDirectory.empty() && StoreIdentity::choose().change)
        fail("A store with a certificate of ACME does not run as root's. Start it as a user of its own; the package "
             "rolvane-store has one.");
    if (!options.acmeDirectory.empty()) CXPathUtils_MakeCompletePath(state + "/md", 0700);
    StorePlaces(state, options.documentRoot, StoreIdentity::choose()).make();
}

int PrivateStore::Implementation::savedPort() const {
    if (!exists(settingsFile())) return 0;
    return static_cast<int>(PropertyList::fromFile(settingsFile()).dictionary()["port"].integer());
}

StoreIdentity PrivateStore::Implementation::identityFor() const {
    StoreIdentity identity = StoreIdentity::choose();
    if (!identity.change) return identity;
    identity.passFileModes = !identity.reaches(state) || !identity.reaches(davDirectory());
    return identity;
}

void PrivateStore::Implementation::writeConfiguration(int port) {
    if (options.tls && options.certificate.empty() && options.acmeDirectory.empty())
        certificates().ensure(options.hosts, options.certificateLifetime);
    const std::string form =
        readFile(options.configurationTemplate.empty() ? storeTemplatePath() : options.configurationTemplate);
    const mode_t mode = StorePlaces::fileMode(StoreIdentity::choose());
    writeFileDurably(launcher().configurationFile(),
                     renderStoreConfiguration(form, options, port, LoopbackPort::hasIPv6()), mode);
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
    if (launcher().running()) return;
    std::vector<std::string> modules{"mod_mpm_event.so", "mod_dav.so", "mod_dav_fs.so"};
    if (!options.acmeDirectory.empty()) modules.emplace_back("mod_md.so");
    launcher().checkProgram(modules);
    checkCertificate();
    checkDigests();
    launcher().endOrphans();
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
    makeTrees(identity);
    try {
        launcher().launch(identity, port, options.tls, options.environment);
    } catch (const CXException&) {
        if (mayMove && !LoopbackPort::isFree(port)) return false;
        throw;
    }
    startedHere = true;
    return true;
}

// httpd reads the passwords at every request, and the access lists ask for no more than a name. Only a store without
// lists has a section of its configuration for each user.
void PrivateStore::Implementation::usersChanged(bool wasRunning) {
    const auto started = savedOptions(state);
    if (!wasRunning || (started && started->keepsAccessLists())) return;
    launcher().stop(HttpdLauncher::Stop::atOnce);
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
    const FileHandle lock = _implementation->launcher().lock();
    _implementation->startLocked();
}

bool PrivateStore::reload() {
    if (!exists(_implementation->settingsFile())) return false;
    _implementation->makeDirectories();
    const HttpdLauncher launcher = _implementation->launcher();
    const FileHandle lock = launcher.lock();
    const auto process = launcher.running();
    if (!process) return false;
    const int port = _implementation->savedPort();
    if (_implementation->options.port && _implementation->options.port != port)
        fail("The store listens on port " + std::to_string(port) +
             ", and another one needs a new start. Stop the store and start it again.");
    _implementation->checkCertificate();
    const std::string former = readFile(launcher.configurationFile());
    const std::string formerSettings = readFile(_implementation->settingsFile());
    _implementation->writeConfiguration(port);
    if (const std::string complaint = launcher.complaint(_implementation->identityFor()); !complaint.empty()) {
        writeFileDurably(launcher.configurationFile(), former, StorePlaces::fileMode(StoreIdentity::choose()));
        writeFileDurably(_implementation->settingsFile(), formerSettings);
        fail("The store goes on as before: httpd does not take the new configuration. It said:\n" + complaint);
    }
    process->signal(SIGUSR1);
    return true;
}

void PrivateStore::stop(Stop how) {
    if (!exists(_implementation->settingsFile())) return;
    _implementation->makeDirectories();
    const FileHandle lock = _implementation->launcher().lock();
    _implementation->launcher().stop(how);
}

PrivateStoreStatus PrivateStore::status() const {
    PrivateStoreStatus status;
    if (const auto process = _implementation->launcher().running()) {
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
    const FileHandle lock = _implementation->launcher().lock();
    const bool known = _implementation->passwords().contains(user);
    _implementation->passwords().set(user, password);
    _implementation->makeTrees(_implementation->identityFor());
    if (!known) _implementation->usersChanged(_implementation->launcher().running().has_value());
}

bool PrivateStore::removeUser(const std::string& user) {
    _implementation->makeDirectories();
    const FileHandle lock = _implementation->launcher().lock();
    if (!_implementation->passwords().remove(user)) return false;
    _implementation->usersChanged(_implementation->launcher().running().has_value());
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
    return _implementation->launcher().errorLog();
}

void PrivateStore::setQuota(const std::string& user, const std::string& quota) {
    _implementation->makeDirectories();
    const FileHandle lock = _implementation->launcher().lock();
    auto all = _implementation->quotas();
    all.erase(user);
    if (!quota.empty()) all[user] = quota;
    std::string text;
    for (const auto& [name, size] : all) text.append(name).append(": ").append(size).append("\n");
    writeFileDurably(_implementation->quotasFile(), text, StorePlaces::fileMode(StoreIdentity::choose()));
}

PrivateStore::Room PrivateStore::roomOf(const std::string& user) const {
    Room room;
    if (_implementation->options.quota.empty()) return room;
    const auto all = _implementation->quotas();
    room.isOwn = all.contains(user);
    room.quota = room.isOwn ? all.at(user) : _implementation->options.quota;
    constexpr size_t kNumber = 20; // digits of each of the two numbers
    const std::string counted = textOfServersFile(stateDirectory() + "/lists/" + user + ".used", 2 * kNumber + 2);
    if (counted.size() == 2 * kNumber + 2) room.used = std::strtoull(counted.c_str() + kNumber, nullptr, 10);
    return room;
}

std::string PrivateStore::baseURL() const {
    const std::string& name = _implementation->options.name;
    return _implementation->urlBy(name.empty() ? "localhost" : name);
}

std::string PrivateStore::localURL() const {
    return _implementation->urlBy("localhost");
}

std::string PrivateStore::certificateFile() const {
    return _implementation->shownCertificate();
}

std::string PrivateStore::authorityFingerprint() const {
    const auto& options = _implementation->options;
    const std::string file = certificateFile();
    if (file.empty())
        fail("The store has no certificate yet: " + options.acmeDirectory +
             " has not given one. The store's log says how far that is: " + errorLog());
    if (!options.certificate.empty() || !options.acmeDirectory.empty())
        return isKnownToTheSystem(file) ? "" : fingerprintOfAuthority(file);
    const std::string own = fingerprintOfCertificate(caFile());
    if (own.empty())
        fail("The authority's file " + caFile() +
             " holds no certificate. `rolvane store stop && rolvane store start` makes another one.");
    return own;
}

std::string PrivateStore::endpointTemplate() const {
    return baseURL() + "/{user}/Contacts";
}

} // namespace rolvane
