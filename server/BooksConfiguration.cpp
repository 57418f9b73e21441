#include "server/BooksConfiguration.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/HttpdTemplate.h"
#include "server/PrivateStore.h"
#include "server/StoreConfiguration.h"
#include "server/UnitConfinement.h"

#include <algorithm>
#include <arpa/inet.h>
#include <filesystem>

namespace rolvane {

namespace {

constexpr const char* kService = "The server of the address books";
constexpr int64_t kBodyRoom = 268435456; // bytes of a body that are read to say that it is too large

std::string numbered(const std::string& address, int port) {
    const bool isIPv6 = address.find(':') != std::string::npos;
    return (isIPv6 ? "[" + address + "]" : address) + ":" + std::to_string(port);
}

// Where clients find the server. An address that stands for all covers the loopback ones of its kind.
std::vector<std::string> openPlaces(const BooksOptions& options, int port, bool withIPv6) {
    std::vector<std::string> places;
    if (options.listen != "0.0.0.0") places.push_back(numbered("127.0.0.1", port));
    if (withIPv6 && options.listen != "::") places.push_back(numbered("::1", port));
    if (!options.listen.empty()) places.push_back(numbered(options.listen, port));
    return places;
}

std::string listenLines(const BooksOptions& options, int port, int inner, bool withIPv6) {
    if (inner != 0) return "Listen " + numbered("127.0.0.1", inner);
    std::vector<std::string> lines = openPlaces(options, port, withIPv6);
    for (std::string& line : lines) line.insert(0, "Listen ");
    std::string text = joinedLines(lines);
    text.pop_back();
    return text;
}

// A path as a unit file wants it: specifiers doubled, in quotation marks.
std::string inUnit(const std::string& path) {
    std::string text;
    for (const char c : path) text += c == '%' ? std::string("%%") : c == '$' ? std::string("$$") : std::string(1, c);
    return "\"" + text + "\"";
}

std::string pathInUnit(const std::string& path) {
    std::string text;
    for (const char c : path) text += c == '%' ? std::string("%%") : std::string(1, c);
    return text;
}

std::string moduleOr(const std::string& given, const std::string& found, const std::string& name) {
    const std::string path = given.empty() ? found : given;
    if (path.empty())
        throw CXException(kCXPrivateStoreException, std::string(kService) + " needs " + name +
                                                        ", which is missing from " ROLVANE_INSTALLED_MODULES
                                                        ". Install rolvane again.");
    refuseUnsafePath(kService, path);
    return path;
}

} // namespace

std::string booksModulePath(const std::string& httpdModules) {
    return httpdModulePath("mod_cardbook.so", ROLVANE_BUILT_CARDBOOK, httpdModules);
}

std::string renderBooksConfiguration(const BooksOptions& options, int port, int inner, bool withIPv6) {
    for (const auto& path : {options.stateDirectory, options.database, options.httpdModules})
        refuseUnsafePath(kService, path);
    const std::string tls = options.stateDirectory + "/tls/server";
    const bool isOwn = !options.certificate.empty();
    for (const auto& path : {options.certificate, options.key})
        if (isOwn) refuseUnsafePath(kService, path);
    refuseUnsafeWord(kService, "log level", options.logLevel);
    std::string text;
    if (options.tls) text += "Define TLS\n";
    if (options.accessLog) text += "Define ACCESSLOG\n";
    const int64_t card = std::max<int64_t>(options.maximumCard, 1024);
    return text + filledIn(readFile(httpdTemplatePath("books.conf.in")),
                           {{"STATE", options.stateDirectory},
                            {"DATABASE", options.database},
                            {"CERTIFICATE", isOwn ? options.certificate : tls + ".pem"},
                            {"KEY", isOwn ? options.key : tls + ".key"},
                            {"MODULES", options.httpdModules},
                            {"DAVACL", moduleOr("", storeAccessModulePath(options.httpdModules), "mod_davacl.so")},
                            {"CARDBOOK", moduleOr(options.cardbookModule, booksModulePath(options.httpdModules),
                                                  "mod_cardbook.so")},
                            {"LISTEN", listenLines(options, port, inner, withIPv6)},
                            {"THREADS", std::to_string(std::clamp(options.threads, 2, 1000))},
                            {"LOG_LEVEL", options.logLevel},
                            {"BODY_LIMIT", std::to_string(card + kBodyRoom)},
                            {"MAX_CARD", std::to_string(card)},
                            {"MAX_REPORT", std::to_string(std::max<int64_t>(options.maximumReport, 1024))},
                            {"EXTRA", joinedLines(options.extraConfiguration)}});
}

std::map<std::string, std::string> renderBooksUnits(const BooksOptions& options, int port, int inner, bool withIPv6) {
    std::string socket = "[Unit]\nDescription=Rolvane: address books for this user's programs and devices\n"
                         "Documentation=man:rolvane(1)\n\n[Socket]\n";
    for (const std::string& place : openPlaces(options, port, withIPv6)) socket += "ListenStream=" + place + "\n";
    // An address that stands for all of IPv6 leaves those of IPv4 to the other lines. An address that the machine has
    // not got yet, right after it was switched on, is waited for.
    socket += "BindIPv6Only=ipv6-only\nFreeBind=yes\n\n[Install]\nWantedBy=sockets.target\n";

    const std::string service =
        "[Unit]\nDescription=Rolvane: hands connections on to the server of the address books\n"
        "Documentation=man:rolvane(1)\nBindsTo=rolvane-books-httpd.service\nAfter=rolvane-books-httpd.service\n\n"
        "[Service]\nExecStart=/lib/systemd/systemd-socket-proxyd --exit-idle-time=10min " +
        numbered("127.0.0.1", inner) + "\nProtectHome=yes\n" + unitConfinement({});

    // Requests carry passwords, and so would a core file.
    const std::string& state = options.stateDirectory;
    const std::string httpd =
        "[Unit]\nDescription=Rolvane: server of the address books\n"
        "Documentation=man:rolvane(1)\nStopWhenUnneeded=yes\n\n"
        "[Service]\nType=forking\nPIDFile=" +
        pathInUnit(state) + "/run/httpd.pid\nExecStart=" + options.httpdProgram + " -d " + inUnit(state) + " -f " +
        inUnit(state + "/conf/httpd.conf") +
        " -k start\nKillMode=mixed\nTimeoutStopSec=10\nLimitNOFILE=16384\nLimitCORE=0\n" +
        unitConfinement({state, std::filesystem::path(options.database).parent_path().string(), "%t"});
    return {
        {"rolvane-books.socket", socket}, {"rolvane-books.service", service}, {"rolvane-books-httpd.service", httpd}};
}

Dictionary booksOptionsToDictionary(const BooksOptions& options, int port, int inner) {
    Dictionary d;
    Array hosts, extra;
    for (const auto& host : options.hosts) hosts.append(host);
    for (const auto& line : options.extraConfiguration) extra.append(line);
    d.set("port", port);
    d.set("innerPort", inner);
    d.set("database", options.database);
    d.set("tls", options.tls);
    d.set("listen", options.listen);
    d.set("hosts", hosts);
    d.set("certificate", options.certificate);
    d.set("key", options.key);
    d.set("threads", options.threads);
    d.set("maximumCard", options.maximumCard);
    d.set("maximumReport", options.maximumReport);
    d.set("logLevel", options.logLevel);
    d.set("accessLog", options.accessLog);
    d.set("extraConfiguration", extra);
    return d;
}

BooksOptions booksOptionsFromDictionary(const Dictionary& d) {
    BooksOptions options;
    const auto texts = [](const Array& array) {
        std::vector<std::string> all;
        for (const auto& value : array) all.push_back(value.string());
        return all;
    };
    options.port = static_cast<int>(d["port"].integer());
    options.database = d["database"].string();
    options.tls = d["tls"].boolean(options.tls);
    options.listen = d["listen"].string();
    options.hosts = texts(d["hosts"].array());
    options.certificate = d["certificate"].string();
    options.key = d["key"].string();
    options.threads = static_cast<int>(d["threads"].integer(options.threads));
    options.maximumCard = d["maximumCard"].integer(options.maximumCard);
    options.maximumReport = d["maximumReport"].integer(options.maximumReport);
    if (d.contains("logLevel")) options.logLevel = d["logLevel"].string();
    options.accessLog = d["accessLog"].boolean(options.accessLog);
    options.extraConfiguration = texts(d["extraConfiguration"].array());
    return options;
}

} // namespace rolvane
