#include "server/BooksServer.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "server/BooksConfiguration.h"
#include "server/LoopbackPort.h"
#include "server/PrivateStore.h"
#include "server/StoreCertificates.h"
#include "server/UserUnits.h"

#include <algorithm>
#include <arpa/inet.h>
#include <array>
#include <cstdlib>
#include <ifaddrs.h>
#include <memory>
#include <net/if.h>
#include <sys/socket.h>
#include <unistd.h>

namespace rolvane {

namespace {

using namespace std::chrono_literals;

constexpr const char* kName = "The server of the address books";
constexpr int kFreshPortAttempts = 5;
constexpr auto kAnswerDeadline = 10s;
constexpr auto kCertificateLifetime = std::chrono::hours(24 * 365 * 5);
const std::vector<std::string> kUnits = {"rolvane-books.socket", "rolvane-books.service",
                                         "rolvane-books-httpd.service"};

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXPrivateStoreException, reason);
}

bool exists(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

std::string orDefault(const std::string& stateDirectory) {
    return HttpdLauncher::withoutLinks(stateDirectory.empty() ? rolvane::stateDirectory() + "/books" : stateDirectory);
}

bool isAddress(const std::string& text) {
    unsigned char bytes[sizeof(in6_addr)];
    return inet_pton(AF_INET, text.c_str(), bytes) == 1 || inet_pton(AF_INET6, text.c_str(), bytes) == 1;
}

bool isEverywhere(const std::string& address) {
    return address == "0.0.0.0" || address == "::";
}

std::string hostName() {
    std::array<char, 256> name{};
    return gethostname(name.data(), name.size() - 1) == 0 ? name.data() : "";
}

// The addresses by which other machines may know this one. Those of a link alone are no use in a certificate.
std::vector<std::string> addressesOfThisMachine() {
    std::vector<std::string> addresses;
    ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return addresses;
    const std::unique_ptr<ifaddrs, decltype(&freeifaddrs)> all(list, &freeifaddrs);
    for (const ifaddrs* each = list; each; each = each->ifa_next) {
        if (!each->ifa_addr || (each->ifa_flags & IFF_LOOPBACK) || !(each->ifa_flags & IFF_UP)) continue;
        std::array<char, INET6_ADDRSTRLEN> text{};
        if (each->ifa_addr->sa_family == AF_INET) {
            const auto* address = reinterpret_cast<const sockaddr_in*>(each->ifa_addr);
            inet_ntop(AF_INET, &address->sin_addr, text.data(), text.size());
        } else if (each->ifa_addr->sa_family == AF_INET6) {
            const auto* address = reinterpret_cast<const sockaddr_in6*>(each->ifa_addr);
            if (!IN6_IS_ADDR_LINKLOCAL(&address->sin6_addr))
                inet_ntop(AF_INET6, &address->sin6_addr, text.data(), text.size());
        }
        if (text[0]) addresses.emplace_back(text.data());
    }
    return addresses;
}

// Root's server may change root's files, so that it can write the contact database. It keeps nothing else of root.
StoreIdentity identityOfServer() {
    StoreIdentity identity = StoreIdentity::choose();
    identity.passFileModes = identity.changeFiles = identity.change;
    return identity;
}

// The contacts' room looks for the user's places by these.
std::vector<std::string> placesOfUser() {
    std::vector<std::string> variables;
    for (const char* name : {"HOME", "XDG_DATA_HOME", "XDG_STATE_HOME", "XDG_CONFIG_HOME", "XDG_CACHE_HOME",
                             "XDG_RUNTIME_DIR", "DBUS_SESSION_BUS_ADDRESS"})
        if (const char* value = getenv(name)) variables.push_back(std::string(name) + "=" + value);
    return variables;
}

} // namespace

BooksServer::BooksServer(BooksOptions options) : _options(std::move(options)) {
    _options.stateDirectory = orDefault(_options.stateDirectory);
    for (std::string* file : {&_options.certificate, &_options.key})
        if (!file->empty()) *file = HttpdLauncher::withoutLinks(*file);
    if (!_options.database.empty()) _options.database = HttpdLauncher::withoutLinks(_options.database);
}

BooksServer::~BooksServer() {
    if (!_options.ownsProcess || !_startedHere) return;
    try {
        off();
    } catch (const CXException&) {
        // A destructor has nobody to tell; the server is still there for `off`.
    }
}

std::optional<BooksOptions> BooksServer::savedOptions(const std::string& stateDirectory) {
    const std::string state = orDefault(stateDirectory);
    if (!exists(state + "/books.plist")) return std::nullopt;
    BooksOptions options = booksOptionsFromDictionary(PropertyList::fromFile(state + "/books.plist").dictionary());
    options.stateDirectory = state;
    return options;
}

HttpdLauncher BooksServer::launcher() const {
    return HttpdLauncher({kName, _options.stateDirectory, _options.httpdProgram, _options.httpdModules});
}

int BooksServer::savedPort() const {
    if (!exists(settingsFile())) return 0;
    return static_cast<int>(PropertyList::fromFile(settingsFile()).dictionary()["port"].integer());
}

int BooksServer::savedInnerPort() const {
    if (!exists(settingsFile())) return 0;
    return static_cast<int>(PropertyList::fromFile(settingsFile()).dictionary()["innerPort"].integer());
}

bool BooksServer::isManaged() const {
    return _options.serviceManager && UserUnits::has(kUnits.front());
}

void BooksServer::makeDirectories() const {
    for (const char* name : {"/conf", "/tls", "/run", "/logs", "/root", "/used"})
        CXPathUtils_MakeCompletePath(_options.stateDirectory + name, 0700);
}

void BooksServer::checkOptions() const {
    if (!exists(_options.database))
        fail("There is no contact database at " + _options.database +
             ". Make it with `rolvane import FILE` or `rolvane add`, then switch the address books on.");
    if (!_options.certificate.empty() || !_options.key.empty()) {
        const std::string wrong = certificateProblem(_options.certificate, _options.key);
        if (!wrong.empty())
            fail(wrong +
                 " Give --certificate and --key as PEM files that belong together, the certificate with the ones "
                 "that sign it behind it; or --made-certificate for one that this machine makes.");
    }
    if (_options.listen.empty()) return;
    if (!isAddress(_options.listen))
        fail("\"" + _options.listen +
             "\" is no address of this machine. Give one as numbers, for instance 192.168.1.20, or 0.0.0.0 for all "
             "(`ip address` lists them).");
    if (!_options.tls)
        fail("Without TLS the address books are served on this machine alone: passwords and contacts would cross the "
             "network for everybody to read. Leave out --listen or --no-tls.");
    if (geteuid() == 0)
        fail("Root's address books are served on this machine alone, since their server may change root's files. "
             "Switch them on as the user whose contacts they are.");
}

void BooksServer::checkPort(int port) const {
    if (!LoopbackPort::isFree(port))
        fail(std::string(kName) + " has the port " + std::to_string(port) +
             ", which is taken by another program. Stop that program, or choose another port with --port (your devices "
             "know the address books by their port, so they have to be told).");
}

std::vector<std::string> BooksServer::certificateHosts() const {
    std::vector<std::string> hosts = {"localhost", "127.0.0.1", "::1"};
    const auto add = [&](const std::string& host) {
        if (!host.empty() && std::find(hosts.begin(), hosts.end(), host) == hosts.end()) hosts.push_back(host);
    };
    for (const std::string& host : _options.hosts) add(host);
    if (isEverywhere(_options.listen)) {
        for (const std::string& address : addressesOfThisMachine()) add(address);
    } else {
        add(_options.listen);
    }
    if (!_options.listen.empty()) add(hostName());
    return hosts;
}

void BooksServer::writeConfiguration(int port, int inner) const {
    StoreCertificates certificates(_options.stateDirectory + "/tls");
    if (_options.tls && _options.certificate.empty()) certificates.ensure(certificateHosts(), kCertificateLifetime);
    const std::string passwords = _options.stateDirectory + "/conf/passwords";
    if (!exists(passwords)) writeFileDurably(passwords, "");
    writeFileDurably(launcher().configurationFile(),
                     renderBooksConfiguration(_options, port, inner, LoopbackPort::hasIPv6()));
    writeFileDurably(settingsFile(), PropertyList::toXML(booksOptionsToDictionary(_options, port, inner)));
}

void BooksServer::on() {
    checkOptions();
    makeDirectories();
    const FileHandle lock = launcher().lock();
    const int port = _options.port ? _options.port : savedPort();
    const auto wanted = [&] { return PropertyList::toXML(booksOptionsToDictionary(_options, port, savedInnerPort())); };
    if (status().on) {
        if (readFile(settingsFile()) == wanted()) return;
        stopAll();
    }
    launcher().checkProgram({"mod_mpm_event.so", "mod_dav.so", "mod_auth_basic.so", "mod_alias.so"});
    launcher().endOrphans();
    if (port) checkPort(port);
    if (_options.serviceManager && UserUnits::available()) {
        startUnits(port ? port : LoopbackPort::choose());
        return;
    }
    for (int attempt = 1;; ++attempt)
        if (startProcess(port ? port : LoopbackPort::choose(), !port && attempt < kFreshPortAttempts)) return;
}

// False when the port was taken in the meantime and another one may be tried.
bool BooksServer::startProcess(int port, bool mayMove) {
    writeConfiguration(port, 0);
    try {
        launcher().launch(identityOfServer(), port, _options.tls, placesOfUser());
    } catch (const CXException&) {
        if (mayMove && !LoopbackPort::isFree(port)) return false;
        throw;
    }
    _startedHere = true;
    return true;
}

void BooksServer::startUnits(int port) {
    int inner = savedInnerPort();
    while (inner == 0 || inner == port) inner = LoopbackPort::choose();
    writeConfiguration(port, inner);
    UserUnits::install(renderBooksUnits(_options, port, inner, LoopbackPort::hasIPv6()));
    try {
        UserUnits::enable(kUnits.front());
        // The first connection starts httpd, so that an error shows here and not at a device.
        if (!LoopbackPort::answers(port, _options.tls, kAnswerDeadline))
            fail(std::string(kName) + " does not answer. `systemctl --user status rolvane-books-httpd.service` and " +
                 errorLog() + " say why.");
    } catch (const CXException&) {
        UserUnits::remove(kUnits);
        throw;
    }
    _startedHere = true;
}

void BooksServer::stopAll() const {
    if (isManaged()) UserUnits::remove(kUnits);
    launcher().stop(HttpdLauncher::Stop::gracefully);
}

void BooksServer::off() {
    if (!exists(settingsFile())) return;
    makeDirectories();
    const FileHandle lock = launcher().lock();
    stopAll();
}

BooksStatus BooksServer::status() const {
    BooksStatus status;
    status.port = savedPort();
    status.managed = isManaged();
    if (const auto process = launcher().running()) status.pid = process->pid();
    status.on = status.managed ? UserUnits::isActive(kUnits.front()) : status.pid != 0;
    return status;
}

std::string BooksServer::caFile() const {
    if (!_options.certificate.empty()) return {};
    return StoreCertificates(_options.stateDirectory + "/tls").caFile();
}

std::string BooksServer::fingerprint() const {
    if (!_options.tls) return {};
    if (!_options.certificate.empty()) return fingerprintOfCertificate(_options.certificate);
    return StoreCertificates(_options.stateDirectory + "/tls").fingerprint();
}

std::string BooksServer::url() const {
    const int port = savedPort();
    if (port == 0) fail("The address books have never been switched on. Do it with: rolvane books on");
    return (_options.tls ? "https" : "http") + std::string("://localhost:") + std::to_string(port) + "/";
}

std::string BooksServer::outsideURL() const {
    if (_options.listen.empty()) return {};
    std::string host = _options.listen;
    if (isEverywhere(host)) {
        const std::vector<std::string> addresses = addressesOfThisMachine();
        host = !_options.hosts.empty() ? _options.hosts.front() : addresses.empty() ? hostName() : addresses.front();
    }
    if (host.find(':') != std::string::npos) host = "[" + host + "]";
    return "https://" + host + ":" + std::to_string(savedPort()) + "/";
}

} // namespace rolvane
