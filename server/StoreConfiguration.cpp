#include "server/StoreConfiguration.h"

#include "foundation/CXException.h"

#include <algorithm>
#include <filesystem>
#include <map>
#include <unistd.h>

namespace rolvane {

namespace {

std::string programDirectory() {
    std::error_code error;
    return std::filesystem::read_symlink("/proc/self/exe", error).parent_path().string();
}

void refuseUnsafePath(const std::string& path) {
    const bool unsafe = path.find_first_of("\"\\\n\r") != std::string::npos || path.find("${") != std::string::npos;
    if (unsafe || path.empty() || path[0] != '/')
        throw CXException(kCXPrivateStoreException, "The store cannot be kept in \"" + path +
                                                        "\": the path must be absolute and hold no quotation mark, "
                                                        "backslash, line break or \"${\". Choose another directory.");
}

void refuseUnsafeWord(const std::string& what, const std::string& word) {
    const bool safe = !word.empty() && std::all_of(word.begin(), word.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == ':' || c == ' ' || c == '_';
    });
    if (!safe) throw CXException(kCXPrivateStoreException, "The store's " + what + " \"" + word + "\" is none.");
}

std::string switches(const PrivateStoreOptions& options) {
    std::string text;
    if (options.tls) text += "Define TLS\n";
    if (options.http2) text += "Define HTTP2\n";
    if (options.accessLog) text += "Define ACCESSLOG\n";
    if (options.authentication == StoreAuthentication::basic) text += "Define BASIC\n";
    if (options.authentication == StoreAuthentication::digest) text += "Define DIGEST\n";
    if (options.needsModule()) text += "Define DAVACL\n";
    if (options.keepsAccessLists()) text += "Define ACCESSLISTS\n";
    return text;
}

std::string joined(const std::vector<std::string>& lines) {
    std::string text;
    for (const auto& line : lines) text += line + "\n";
    return text;
}

// Replaces every @NAME@; a name that is not known stays, and httpd complains about it.
std::string substitute(const std::string& text, const std::map<std::string, std::string>& names) {
    std::string out;
    for (size_t from = 0; from < text.size();) {
        const size_t at = text.find('@', from);
        const size_t end = at == std::string::npos ? at : text.find('@', at + 1);
        if (end == std::string::npos) return out + text.substr(from);
        const auto known = names.find(text.substr(at + 1, end - at - 1));
        out += text.substr(from, at - from);
        out += known == names.end() ? text.substr(at, end - at) : known->second;
        from = known == names.end() ? end : end + 1;
    }
    return out;
}

constexpr const char* kAuthenticationNames[] = {"none", "basic", "digest"};

Array toArray(const std::vector<std::string>& texts) {
    Array array;
    for (const auto& text : texts) array.append(text);
    return array;
}

std::vector<std::string> toStrings(const Array& array) {
    std::vector<std::string> texts;
    for (const auto& value : array) texts.push_back(value.string());
    return texts;
}

} // namespace

std::string storeTemplatePath() {
    const std::string candidates[] = {programDirectory() + "/../share/rolvane/httpd.conf.in",
                                      ROLVANE_SERVER_SOURCE_DIR "/httpd.conf.in",
                                      ROLVANE_INSTALLED_SHARE "/httpd.conf.in"};
    for (const auto& path : candidates)
        if (access(path.c_str(), R_OK) == 0) return path;
    throw CXException(kCXPrivateStoreException, "The store's configuration template httpd.conf.in is missing from " +
                                                    std::string(ROLVANE_INSTALLED_SHARE) + ". Install rolvane again.");
}

std::string storeAccessModulePath(const std::string& httpdModules) {
    // What was built or installed together with the program comes before what the system may have from another version.
    const std::string candidates[] = {programDirectory() + "/../lib/apache2/modules/mod_davacl.so",
                                      ROLVANE_BUILT_DAVACL,

                                      ROLVANE_INSTALLED_MODULES "/mod_davacl.so", httpdModules + "/mod_davacl.so"};
    for (const auto& path : candidates)
        if (access(path.c_str(), R_OK) == 0) return path;
    return {};
}

std::string renderStoreConfiguration(const std::string& templateText, const PrivateStoreOptions& options, int port,
                                     bool withIPv6) {
    for (const auto& path : {options.stateDirectory, options.documentRoot, options.httpdModules})
        refuseUnsafePath(path);
    refuseUnsafeWord("log level", options.logLevel);
    const std::string module = !options.needsModule()         ? "/none"
                               : options.accessModule.empty() ? storeAccessModulePath(options.httpdModules)
                                                              : options.accessModule;
    if (module.empty())
        throw CXException(kCXPrivateStoreException,
                          "The store's access lists and passwords need mod_davacl.so, which is missing from " +
                              std::string(ROLVANE_INSTALLED_MODULES) + ". Install rolvane again.");
    refuseUnsafePath(module);
    const std::string number = std::to_string(port);
    const int threads = std::clamp(options.threadsPerProcess, 1, 1000);
    const int processes = std::clamp(options.processes, 1, 100);
    const int limit = std::clamp(options.maximumProcesses, processes, 100);
    return switches(options) +
           substitute(templateText,
                      {{"STATE", options.stateDirectory},
                       {"ROOT", options.documentRoot},
                       {"MODULES", options.httpdModules},
                       {"DAVACL", module},
                       {"REALM", kStoreRealm},
                       {"LISTEN", "Listen 127.0.0.1:" + number + (withIPv6 ? "\nListen [::1]:" + number : "")},
                       {"PROCESSES", std::to_string(processes)},
                       {"SERVER_LIMIT", std::to_string(2 * limit)},
                       {"THREADS", std::to_string(threads)},
                       {"SPARE_THREADS", std::to_string(std::max(threads / 2, 1))},
                       {"WORKERS", std::to_string(threads * limit)},
                       {"KEEPALIVE_TIMEOUT", std::to_string(std::max(options.keepAliveSeconds, 1))},
                       {"KEEPALIVE_REQUESTS", std::to_string(std::max(options.maximumKeepAliveRequests, 0))},
                       {"LOG_LEVEL", options.logLevel},
                       {"EXTRA", joined(options.extraConfiguration)}});
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
    readInteger("port", options.port);
    readInteger("processes", options.processes);
    readInteger("maximumProcesses", options.maximumProcesses);
    readInteger("threadsPerProcess", options.threadsPerProcess);
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
