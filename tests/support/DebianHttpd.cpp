#include "support/DebianHttpd.h"

#include "foundation/Paths.h"
#include "server/LoopbackPort.h"
#include "server/StoreCertificates.h"
#include "server/StoreConfiguration.h"

#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <pwd.h>
#include <sstream>
#include <stdexcept>
#include <unistd.h>

namespace rolvane::test {

namespace {

namespace fs = std::filesystem;

// A fresh installation has these enabled: the package's maintainer script names them.
constexpr const char* kModules[] = {"access_compat", "alias",      "auth_basic", "authn_core", "authn_file",
                                    "authz_core",    "authz_host", "authz_user", "autoindex",  "deflate",
                                    "dir",           "env",        "filter",     "mime",       "mpm_event",
                                    "negotiation",   "reqtimeout", "setenvif",   "status"};
constexpr const char* kParts[] = {"charset", "localized-error-pages", "other-vhosts-access-log", "security",
                                  "serve-cgi-bin"};
constexpr const char* kShipped = "/etc/apache2";
constexpr const char* kPage = ROLVANE_DOCUMENTS "/mod_davacl.md";
constexpr const char* kUser = "www-data";

std::string replaced(std::string text, const std::string& from, const std::string& to) {
    for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size())
        text.replace(at, from.size(), to);
    return text;
}

void change(const std::string& file, const std::string& from, const std::string& to) {
    const std::string text = readFile(file);
    if (text.find(from) == std::string::npos) throw std::runtime_error(file + " has no \"" + from + "\"");
    std::ofstream(file) << replaced(text, from, to);
}

} // namespace

std::string DebianHttpd::linesOfThePage() {
    std::istringstream page(readFile(kPage));
    std::string lines;
    for (std::string line; std::getline(page, line);) {
        const bool isCode = line.starts_with("    ");
        if (lines.empty() && !line.starts_with("    DavAclBase ")) continue;
        if (!isCode) break;
        lines += line.substr(4) + "\n";
    }
    if (lines.empty()) throw std::runtime_error(std::string(kPage) + " has no lines to set mod_davacl up");
    return lines;
}

DebianHttpd::DebianHttpd() : _port(LoopbackPort::choose()) {
    const std::string configuration = path("apache2");
    if (!fs::exists(std::string(kShipped) + "/apache2.conf"))
        throw std::runtime_error("the package apache2 is missing: packaging/setup test");
    fs::create_directory(configuration);
    for (const char* name :
         {"apache2.conf", "envvars", "ports.conf", "mods-available", "conf-available", "sites-available"})
        fs::copy(std::string(kShipped) + "/" + name, configuration + "/" + name,
                 fs::copy_options::recursive | fs::copy_options::copy_symlinks);
    for (const char* name : {"magic", "mime.types"})
        if (fs::exists(std::string(kShipped) + "/" + name))
            fs::copy(std::string(kShipped) + "/" + name, configuration + "/" + name);
    for (const char* name : {"mods-enabled", "conf-enabled", "sites-enabled"})
        fs::create_directory(configuration + "/" + name);
    for (const char* name : {"run", "run/socks", "log", "lock"}) fs::create_directory(path(name));
    for (const std::string& each : {documents(), trees(), lists()}) fs::create_directory(each);
    for (const std::string& each : {trees(), lists()}) fs::permissions(each, fs::perms::owner_all);
    fs::permissions(_directory.path(), fs::perms::owner_all | fs::perms::group_exec | fs::perms::others_exec);
    for (const std::string& each : {path("run"), path("run/socks"), path("log"), path("lock"), trees(), lists()})
        give(each);
    std::ofstream(path("dav-users")).flush();

    const std::string port = std::to_string(_port);
    change(configuration + "/ports.conf", "Listen 80\n", "Listen 127.0.0.1:" + port + "\n");
    change(configuration + "/sites-available/000-default.conf", "*:80", "*:" + port);
    change(configuration + "/sites-available/000-default.conf", "/var/www/html", documents());
    change(configuration + "/apache2.conf", "<Directory /var/www/>", "<Directory \"" + documents() + "\">");
    // Module configuration names directories of the machine: a private instance must not share them.
    for (const auto& entry : fs::directory_iterator(configuration + "/mods-available"))
        if (const std::string text = readFile(entry.path()); text.find("/var/run/apache2") != std::string::npos)
            std::ofstream(entry.path()) << replaced(text, "/var/run/apache2", path("run"));
    const std::string modules = "/usr/lib/apache2/modules";
    std::ofstream(configuration + "/mods-available/davacl.load")
        << "# Depends: dav dav_fs\nLoadModule davacl_module \"" << storeAccessModulePath(modules) << "\"\n";
    for (const char* module : kModules) enable(module);
    run({"a2enconf", "-q", "charset", "localized-error-pages", "other-vhosts-access-log", "security", "serve-cgi-bin"});
    run({"a2ensite", "-q", "000-default"});
    for (const char* module : {"dav", "dav_fs", "davacl"}) enable(module);
    _site = privatePaths(linesOfThePage());
}

DebianHttpd::~DebianHttpd() {
    if (!_process) return;
    _process->signal(SIGTERM);
    _process->wait(20);
}

std::vector<std::string> DebianHttpd::environment() const {
    const passwd* user = getpwuid(geteuid());
    const std::string name = geteuid() == 0 ? kUser : user ? user->pw_name : "nobody";
    return {"PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
            "LANG=C",
            "APACHE_CONFDIR=" + path("apache2"),
            "APACHE_ENVVARS=" + path("apache2/envvars"),
            "APACHE_RUN_USER=" + name,
            "APACHE_RUN_GROUP=" + name,
            "APACHE_PID_FILE=" + path("run/apache2.pid"),
            "APACHE_RUN_DIR=" + path("run"),
            "APACHE_LOCK_DIR=" + path("lock"),
            "APACHE_LOG_DIR=" + path("log"),
            "A2MODDIR=/nonexistent",
            "APACHE_STATE_DIRECTORY=" + path("state")};
}

void DebianHttpd::run(std::vector<std::string> command) const {
    const std::string name = command.front() + " " + command.back();
    ChildProcess child({.arguments = std::move(command), .environment = environment()});
    child.closeInput();
    const auto ending = child.wait(30);
    if (!ending || !ending->exitedWith(0)) throw std::runtime_error(name + ": " + child.errors() + child.output());
}

void DebianHttpd::enable(const std::string& module) {
    run({"a2enmod", "-q", "-f", module});
}

void DebianHttpd::useTLS() {
    _tls = true;
    enable("ssl");
    fs::create_directory(path("tls"));
    StoreCertificates(path("tls")).ensure({"localhost"}, std::chrono::hours(24));
    _site += "SSLEngine On\nSSLCertificateFile \"" + path("tls/server.pem") + "\"\nSSLCertificateKeyFile \"" +
             path("tls/server.key") + "\"\n";
}

std::string DebianHttpd::endpoint() const {
    return (_tls ? "https" : "http") + std::string("://localhost:") + std::to_string(_port) + "/dav/{user}/Contacts";
}

std::string DebianHttpd::caFile() const {
    return StoreCertificates(path("tls")).caFile();
}

void DebianHttpd::addUser(const std::string& name, const std::string& password) {
    ChildProcess child({.arguments = {"htpasswd", "-i", "-B", path("dav-users"), name}, .input = password + "\n"});
    const auto ending = child.wait(30);
    if (!ending || !ending->exitedWith(0)) throw std::runtime_error("htpasswd: " + child.errors());
    give(path("dav-users"));
}

void DebianHttpd::addServerLines(const std::string& lines) {
    std::ofstream(path("apache2/apache2.conf"), std::ios::app) << "\n" << lines;
}

std::string DebianHttpd::privatePaths(std::string lines) const {
    lines = replaced(std::move(lines), "/var/lib/apache2/davacl", lists());
    lines = replaced(std::move(lines), "/var/lib/apache2/dav", trees());
    lines = replaced(std::move(lines), "/etc/apache2/dav-users", path("dav-users"));
    return replaced(std::move(lines), "/var/lock/apache2", path("lock"));
}

void DebianHttpd::writeSite() {
    change(path("apache2/sites-available/000-default.conf"), "</VirtualHost>", _site + "\n</VirtualHost>");
}

std::vector<std::string> DebianHttpd::command() const {
    return {"/usr/sbin/apache2", "-d", path("apache2"), "-f", path("apache2/apache2.conf"), "-DFOREGROUND"};
}

void DebianHttpd::start() {
    writeSite();
    _process = std::make_unique<ChildProcess>(
        ChildProcess::Options{.arguments = command(), .environment = environment(), .directory = "/"});
    _process->closeInput();
    constexpr auto kPatience = std::chrono::seconds(20);
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (_process->running() && !fs::exists(path("run/apache2.pid")) && std::chrono::steady_clock::now() < deadline)
        usleep(5000);
    if (!_process->running() || !LoopbackPort::answers(_port, _tls, kPatience))
        throw std::runtime_error("Debian's httpd did not start: " + _process->errors() + log());
}

std::string DebianHttpd::complaint() {
    writeSite();
    for (int attempt = 0;; ++attempt) {
        ChildProcess child({.arguments = command(), .environment = environment(), .directory = "/"});
        child.closeInput();
        const auto ending = child.wait(20);
        if (!ending || ending->exitedWith(0)) throw std::runtime_error("Debian's httpd has started");
        const std::string said = child.errors() + log();
        if (attempt == 5 || said.find("Address already in use") == std::string::npos) return said;
        moveToAnotherPort(); // somebody else has taken it meanwhile
    }
}

void DebianHttpd::moveToAnotherPort() {
    const std::string former = ":" + std::to_string(_port);
    _port = LoopbackPort::choose();
    for (const char* file :
         {"apache2/ports.conf", "apache2/sites-available/000-default.conf", "apache2/apache2.conf"}) {
        const std::string text = readFile(path(file));
        std::ofstream(path(file)) << replaced(text, former, ":" + std::to_string(_port));
    }
    fs::remove(path("log/error.log"));
}

std::string DebianHttpd::log() const {
    std::ifstream file(path("log/error.log"));
    std::ostringstream text;
    text << file.rdbuf();
    return text.str();
}

void DebianHttpd::give(const std::string& place) const {
    if (geteuid() != 0) return;
    const passwd* user = getpwnam(kUser);
    if (!user || chown(place.c_str(), user->pw_uid, user->pw_gid) != 0)
        throw std::runtime_error(place + " cannot be given to " + kUser);
}

} // namespace rolvane::test
