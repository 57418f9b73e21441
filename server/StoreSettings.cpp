#include "server/StoreSettings.h"

#include "foundation/CXException.h"

#include <algorithm>
#include <cctype>
#include <functional>
#include <map>
#include <sstream>

namespace rolvane {

namespace {

constexpr const char* kLetsEncrypt = "https://acme-v02.api.letsencrypt.org/directory";
constexpr int kHttpsPort = 443;

std::string trimmed(const std::string& text) {
    const size_t from = text.find_first_not_of(" \t\r");
    return from == std::string::npos ? "" : text.substr(from, text.find_last_not_of(" \t\r") - from + 1);
}

// A name as DNS has it, with a dot or without.
bool isHostName(const std::string& name) {
    constexpr size_t kLongest = 253;
    return !name.empty() && name.size() <= kLongest && std::isalnum(static_cast<unsigned char>(name.front())) != 0 &&
           std::all_of(name.begin(), name.end(),
                       [](unsigned char c) { return std::isalnum(c) != 0 || c == '-' || c == '.'; });
}

// One word that stands between quotation marks in httpd's configuration.
bool isWord(const std::string& text) {
    return !text.empty() && std::all_of(text.begin(), text.end(), [](unsigned char c) {
        return std::isgraph(c) != 0 && std::string_view("\"\\$").find(static_cast<char>(c)) == std::string_view::npos;
    });
}

bool isPath(const std::string& text) {
    return text.starts_with('/') && isWord(text);
}

// Takes a setting's value in; false when it is none.
using Take = std::function<bool(PrivateStoreOptions&, const std::string&)>;

const std::map<std::string, Take>& settings() {
    static const auto text = [](std::string PrivateStoreOptions::*member, bool (*isGood)(const std::string&)) -> Take {
        return [=](PrivateStoreOptions& o, const std::string& value) {
            o.*member = value;
            return isGood(value);
        };
    };
    static const std::map<std::string, Take> all{
        {"name", text(&PrivateStoreOptions::name, isHostName)},
        {"port",
         [](PrivateStoreOptions& o, const std::string& value) {
             const bool isNumber =
                 !value.empty() && value.size() < 6 &&
                 std::all_of(value.begin(), value.end(), [](unsigned char c) { return std::isdigit(c); });
             o.port = isNumber ? std::stoi(value) : 0;
             return o.port > 0 && o.port < 65536;
         }},
        {"certificate",
         [](PrivateStoreOptions& o, const std::string& value) {
             o.certificate = isPath(value) ? value : "";
             o.acmeDirectory = value == "acme" ? kLetsEncrypt : "";
             return isPath(value) || value == "acme" || value == "own";
         }},
        {"key", text(&PrivateStoreOptions::certificateKey, isPath)},
        {"acme-directory", text(&PrivateStoreOptions::acmeDirectory, isWord)},
        {"acme-contact", text(&PrivateStoreOptions::acmeContact, isWord)},
        {"acme-authority", text(&PrivateStoreOptions::acmeAuthority, isPath)},
        {"quota", text(&PrivateStoreOptions::quota, isQuota)},
        {"access-log",
         [](PrivateStoreOptions& o, const std::string& value) {
             o.accessLog = value == "on";
             return value == "on" || value == "off";
         }},
    };
    return all;
}

[[noreturn]] void fail(const std::string& reason) {
    throw CXException(kCXPrivateStoreException, reason);
}

} // namespace

bool isQuota(const std::string& text) {
    if (text == "none") return true;
    const size_t digits = std::min(text.find_first_not_of("0123456789"), text.size());
    constexpr size_t kMostDigits = 12;
    return digits > 0 && digits <= kMostDigits &&
           (digits == text.size() ||
            (digits + 1 == text.size() && std::string_view("KMGT").find(text.back()) != std::string_view::npos));
}

PrivateStoreOptions withStoreSettings(PrivateStoreOptions options, const std::string& text) {
    std::map<std::string, std::string> given;
    std::istringstream lines(text);
    int number = 0;
    for (std::string line; std::getline(lines, line);) {
        ++number;
        line = trimmed(line);
        if (line.empty() || line.front() == '#') continue;
        const size_t equals = line.find('=');
        const std::string key = trimmed(line.substr(0, equals));
        if (equals == std::string::npos || !settings().contains(key))
            fail("Line " + std::to_string(number) + " of the store's settings, \"" + line +
                 "\", is none: a setting is one of name, port, certificate, key, acme-directory, acme-contact, "
                 "acme-authority, quota and access-log, an equals sign, and its value.");
        given[key] = trimmed(line.substr(equals + 1));
    }
    options.port = kHttpsPort;
    options.acmeDirectory = kLetsEncrypt; // where nothing else is said
    options.certificate = options.certificateKey = options.acmeContact = options.acmeAuthority = "";
    options.quota = "none";
    options.accessLog = false;
    // `certificate` goes before the settings that make it more exact.
    if (given.contains("certificate") && !settings().at("certificate")(options, given["certificate"]))
        fail("The store's setting \"certificate\" is acme, own, or the absolute path of a file, and not \"" +
             given["certificate"] + "\".");
    const bool wantsAcme = !options.acmeDirectory.empty();
    for (const auto& [key, value] : given) {
        if (key != "certificate" && !settings().at(key)(options, value))
            fail("The store's setting \"" + key + "\" cannot be \"" + value + "\".");
        if (key.starts_with("acme-") && !wantsAcme)
            fail("The store's setting \"" + key + "\" needs certificate = acme.");
    }
    if (!given.contains("name"))
        fail("The store's settings do not say under which name it is known. Add a line such as: name = "
             "dav.example.org");
    if (options.certificate.empty() == given.contains("key"))
        fail("The store's settings need both or neither: the file of a certificate, and the file of its key.");
    // httpd's module makes no account with the authority without one.
    if (wantsAcme && options.acmeContact.empty())
        fail("The store's settings do not say to whom the certificate's authority may write. Add a line such as: "
             "acme-contact = you@example.org");
    options.hosts = {options.name, "localhost", "127.0.0.1", "::1"};
    options.tls = true;
    options.authentication = StoreAuthentication::basic;
    options.accessLists = true;
    options.slowsGuesses = true;
    return options;
}

} // namespace rolvane
