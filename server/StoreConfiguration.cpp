#include "server/StoreConfiguration.h"

#include "foundation/CXException.h"
#include "foundation/Url.h"
#include "server/HttpdTemplate.h"

#include <algorithm>
#include <filesystem>

namespace rolvane {

namespace {

std::string switches(const PrivateStoreOptions& options) {
    std::string text;
    if (options.tls) text += "Define TLS\n";
    if (options.http2) text += "Define HTTP2\n";
    if (options.accessLog) text += "Define ACCESSLOG\n";
    if (options.authentication == StoreAuthentication::basic) text += "Define BASIC\n";
    if (options.authentication == StoreAuthentication::digest) text += "Define DIGEST\n";
    if (options.needsModule()) text += "Define DAVACL\n";
    if (options.keepsAccessLists()) text += "Define ACCESSLISTS\n";
    if (!options.acmeDirectory.empty()) text += "Define ACME\n";
    if (!options.quota.empty()) text += "Define QUOTA\n";
    if (options.slowsGuesses) text += "Define SLOWGUESSES\n";
    return text;
}

// Of stores that earlier versions started, where nobody could choose it.
constexpr int kEarlierThreadsPerProcess = 32;

constexpr const char* kAuthenticationNames[] = {"none", "basic", "digest"};

Array toArray(const std::vector<std::string>& texts) {
    Array array;
    for (const auto& text : texts) array.append(text);
    return array;
}

std::string quoted(const std::string& text) {
    refuseUnsafePath("The store", "/" + text); // as an argument it may begin with anything
    return "\"" + text + "\"";
}

// A name of its own is known from everywhere, so httpd listens on all addresses of the machine, whatever their kind.
std::string listenLines(const PrivateStoreOptions& options, const std::string& port, bool withIPv6) {
    if (!options.name.empty()) return "Listen " + port;
    return "Listen 127.0.0.1:" + port + (withIPv6 ? "\nListen [::1]:" + port : "");
}

std::string acmeLines(const PrivateStoreOptions& options) {
    std::string lines;
    if (!options.acmeContact.empty()) lines += "  MDContactEmail " + quoted(options.acmeContact) + "\n";
    if (!options.acmeAuthority.empty()) lines += "  MDCACertificateFile " + quoted(options.acmeAuthority) + "\n";
    return lines;
}

// The program's path is the one that it runs from now.
std::string reloadCommand(const PrivateStoreOptions& options) {
    std::error_code error;
    const std::string program =
        options.program.empty() ? std::filesystem::read_symlink("/proc/self/exe", error).string() : options.program;
    // httpd hands its environment on, which has no home in it.
    return "/usr/bin/env " + quoted("HOME=" + options.stateDirectory) + " " + quoted(program) +
           " store reload --quiet --directory " + quoted(options.stateDirectory) + " --event";
}

std::vector<std::string> toStrings(const Array& array) {
    std::vector<std::string> texts;
    for (const auto& value : array) texts.push_back(value.string());
    return texts;
}

} // namespace

std::string storeTemplatePath() {
    return httpdTemplatePath("httpd.conf.in");
}

std::string storeAccessModulePath(const std::string& httpdModules) {
    return httpdModulePath("mod_davacl.so", ROLVANE_BUILT_DAVACL, httpdModules);
}

std::string renderStoreConfiguration(const std::string& templateText, const PrivateStoreOptions& options, int port,
                                     bool withIPv6) {
    for (const auto& path : {options.stateDirectory, options.documentRoot, options.httpdModules})
        refuseUnsafePath("The store", path);
    refuseUnsafeWord("The store", "log level", options.logLevel);
    const std::string module = !options.needsModule()         ? "/none"
                               : options.accessModule.empty() ? storeAccessModulePath(options.httpdModules)
                                                              : options.accessModule;
    if (module.empty())
        throw CXException(kCXPrivateStoreException,
                          "The store's access lists and passwords need mod_davacl.so, which is missing from " +
                              std::string(ROLVANE_INSTALLED_MODULES) + ". Install rolvane again.");
    refuseUnsafePath("The store", module);
    const std::string tls = options.stateDirectory + "/tls/server";
    const bool isGiven = !options.certificate.empty();
    const std::string certificate = isGiven ? options.certificate : tls + ".pem";
    for (const auto& path : {certificate, isGiven ? options.certificateKey : tls}) refuseUnsafePath("The store", path);
    const std::string number = std::to_string(port);
    const int threads = std::clamp(options.threadsPerProcess, 1, 1000);
    const int processes = std::clamp(options.processes, 1, 100);
    const int limit = std::clamp(options.maximumProcesses, processes, 100);
    return switches(options) +
           filledIn(templateText,
                    {{"STATE", options.stateDirectory},
                     {"ROOT", options.documentRoot},
                     {"MODULES", options.httpdModules},
                     {"DAVACL", module},
                     {"REALM", kStoreRealm},
                     {"NAME", options.name.empty() ? "localhost" : options.name},
                     {"LISTEN", listenLines(options, number, withIPv6)},
                     {"PORT", number},
                     {"CERTIFICATE", certificate},
                     {"KEY", isGiven ? options.certificateKey : tls + ".key"},
                     {"ACME_DIRECTORY", quoted(options.acmeDirectory)},
                     {"ACME_MORE", acmeLines(options)},
                     {"ACME_PROTOCOL", options.acmeDirectory.empty() ? "" : "acme-tls/1"},
                     {"RELOAD", reloadCommand(options)},
                     {"QUOTA", options.quota},
                     {"PROCESSES", std::to_string(processes)},
                     {"SERVER_LIMIT", std::to_string(2 * limit)},
                     {"THREADS", std::to_string(threads)},
                     // A sixteenth of all connections of the process, so that there is room for others.
                     {"NEWCOMERS", std::to_string(4 * threads)},
                     {"UPLOADS", std::to_string(std::max(threads / 2, 1))}, // others have the other threads
                     {"SLOW_THREADS", std::to_string(std::max(3 * threads / 4, 1))},
                     {"SPARE_THREADS", std::to_string(std::max(threads / 2, 1))},
                     {"WORKERS", std::to_string(threads * limit)},
                     {"KEEPALIVE_TIMEOUT", std::to_string(std::max(options.keepAliveSeconds, 1))},
                     {"KEEPALIVE_REQUESTS", std::to_string(std::max(options.maximumKeepAliveRequests, 0))},
                     {"LOG_LEVEL", options.logLevel},
                     {"EXTRA", joinedLines(options.extraConfiguration)}});
}

std::string storePasswordPath(const PrivateStoreOptions& options, const std::string& user) {
    if (!options.keepsAccessLists() || options.authentication != StoreAuthentication::basic) return {};
    return "/principals/users/" + Url::percentEncodeComponent(user);
}

std::string renderStoreUsers(const std::string& davDirectory, const std::vector<std::string>& users,
                             StoreAuthentication authentication, bool accessLists) {
    std::string text;
    if (accessLists) return text; // the lists say who may do what, in every tree
    for (const auto& user : users) {
        text += "<Directory \"" + davDirectory + "/" + user + "\">\n  ";
        if (authentication == StoreAuthentication::none)
            text += "Require all granted";
        else
            text += "Require user " + user;
        text += "\n</Directory>\n";
    }
    return text;
}

Dictionary storeOptionsToDictionary(const PrivateStoreOptions& options, int port) {
    Dictionary d;
    d.set("documentRoot", options.documentRoot);
    d.set("port", port);
    d.set("tls", options.tls);
    d.set("authentication", kAuthenticationNames[static_cast<int>(options.authentication)]);
    d.set("http2", options.http2);
    d.set("accessLists", options.accessLists);
    d.set("hosts", toArray(options.hosts));
    d.set("name", options.name);
    d.set("certificate", options.certificate);
    d.set("certificateKey", options.certificateKey);
    d.set("acmeDirectory", options.acmeDirectory);
    d.set("acmeContact", options.acmeContact);
    d.set("acmeAuthority", options.acmeAuthority);
    d.set("quota", options.quota);
    d.set("slowsGuesses", options.slowsGuesses);
    d.set("processes", options.processes);
    d.set("maximumProcesses", options.maximumProcesses);
    d.set("threadsPerProcess", options.threadsPerProcess);
    d.set("keepAliveSeconds", options.keepAliveSeconds);
    d.set("maximumKeepAliveRequests", options.maximumKeepAliveRequests);
    d.set("logLevel", options.logLevel);
    d.set("accessLog", options.accessLog);
    d.set("extraConfiguration", toArray(options.extraConfiguration));
    return d;
}

PrivateStoreOptions storeOptionsFromDictionary(const Dictionary& d) {
    PrivateStoreOptions options;
    const auto readInteger = [&](const char* key, int& into) { into = static_cast<int>(d[key].integer(into)); };
    options.documentRoot = d["documentRoot"].string();
    options.tls = d["tls"].boolean(options.tls);
    for (int i = 0; i < 3; ++i)
        if (d["authentication"].string() == kAuthenticationNames[i]) options.authentication = StoreAuthentication(i);
    options.http2 = d["http2"].boolean(options.http2);
    options.accessLists = d["accessLists"].boolean(options.accessLists);
    if (d.contains("hosts")) options.hosts = toStrings(d["hosts"].array());
    options.name = d["name"].string();
    options.certificate = d["certificate"].string();
    options.certificateKey = d["certificateKey"].string();
    options.acmeDirectory = d["acmeDirectory"].string();
    options.acmeContact = d["acmeContact"].string();
    options.acmeAuthority = d["acmeAuthority"].string();
    options.quota = d["quota"].string();
    options.slowsGuesses = d["slowsGuesses"].boolean(options.slowsGuesses);
    readInteger("port", options.port);
    readInteger("processes", options.processes);
    readInteger("maximumProcesses", options.maximumProcesses);
    const int threads = options.threadsPerProcess;
    readInteger("threadsPerProcess", options.threadsPerProcess);
    if (options.threadsPerProcess == kEarlierThreadsPerProcess) options.threadsPerProcess = threads;
    // Earlier versions kept 60, which nobody had asked for.
    const int longest = options.keepAliveSeconds; // seconds
    readInteger("keepAliveSeconds", options.keepAliveSeconds);
    options.keepAliveSeconds = std::min(options.keepAliveSeconds, longest);
    readInteger("maximumKeepAliveRequests", options.maximumKeepAliveRequests);
    if (d.contains("logLevel")) options.logLevel = d["logLevel"].string();
    options.accessLog = d["accessLog"].boolean(options.accessLog);
    options.extraConfiguration = toStrings(d["extraConfiguration"].array());
    return options;
}

} // namespace rolvane
