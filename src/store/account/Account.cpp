#include "store/account/Account.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "store/account/PasswordReader.h"

#include <algorithm>
#include <arpa/inet.h>
#include <strings.h>
#include <unistd.h>

namespace rolvane {

namespace {

// An endpoint template taken apart: scheme://authority + before + "/<user>" + after, the paths as decoded segments.
struct Endpoint {
    std::string scheme, authority;
    std::vector<std::string> before, after;
};

// The decoded segments of an encoded absolute path, a trailing slash dropped. Nothing when a segment is empty, "." or
// "..", or holds a slash or a control character once decoded.
std::optional<std::vector<std::string>> safeSegments(std::string_view path) {
    std::vector<std::string> out;
    if (!path.empty() && path.front() == '/') path.remove_prefix(1);
    if (!path.empty() && path.back() == '/') path.remove_suffix(1);
    while (!path.empty()) {
        const size_t slash = std::min(path.find('/'), path.size());
        std::string segment = Url::percentDecode(path.substr(0, slash));
        if (segment.empty() || segment == "." || segment == "..") return std::nullopt;
        for (const char c : segment)
            if (c == '/' || static_cast<unsigned char>(c) < 0x20 || c == 0x7f) return std::nullopt;
        out.push_back(std::move(segment));
        if (slash == path.size()) break;
        path.remove_prefix(slash + 1);
        if (path.empty()) return std::nullopt;
    }
    return out;
}

std::optional<Endpoint> parsedTemplate(const std::string& text) {
    Endpoint e;
    const size_t colon = text.find("://");
    if (colon == std::string::npos || text.find_first_of("?#") != std::string::npos) return std::nullopt;
    e.scheme = text.substr(0, colon);
    const size_t slash = text.find('/', colon + 3);
    if (slash == std::string::npos) return std::nullopt;
    e.authority = text.substr(colon + 3, slash - colon - 3);
    if (e.authority.empty() || e.authority.find('@') != std::string::npos) return std::nullopt;
    const auto segments = safeSegments(std::string_view(text).substr(slash));
    if (!segments || std::count(segments->begin(), segments->end(), "{user}") != 1) return std::nullopt;
    const auto user = std::find(segments->begin(), segments->end(), "{user}");
    e.before.assign(segments->begin(), user);
    e.after.assign(user + 1, segments->end());
    return Url::parse(e.scheme + "://" + e.authority + "/") ? std::optional(e) : std::nullopt;
}

std::string originOf(const Endpoint& e) {
    return Url(e.scheme + "://" + e.authority + "/").origin();
}

void appendSegments(std::string& text, const std::vector<std::string>& segments) {
    for (const std::string& s : segments) text += "/" + Url::percentEncodeComponent(s);
}

bool isHttp(std::string_view scheme) {
    return scheme.size() >= 4 && strncasecmp(scheme.data(), "http", 4) == 0 &&
           (scheme.size() == 4 || (scheme.size() == 5 && (scheme[4] == 's' || scheme[4] == 'S')));
}

std::string authorityOf(const Url& url) {
    const std::string host = url.host();
    std::string out = host.find(':') == std::string::npos ? host : "[" + host + "]";
    if (auto port = url.port()) out += ":" + std::to_string(*port);
    return out;
}

const std::pair<PasswordSource::Kind, const char*> kPasswordKinds[] = {
    {PasswordSource::Kind::none, "none"},
    {PasswordSource::Kind::command, "command"},
    {PasswordSource::Kind::credential, "credential"},
    {PasswordSource::Kind::file, "file"},
    {PasswordSource::Kind::keyring, "keyring"},
};
const std::pair<Authentication, const char*> kAuthentications[] = {
    {Authentication::automatic, "automatic"},
    {Authentication::basic, "basic"},
    {Authentication::digest, "digest"},
};

template <class Table, class Key>
std::string nameIn(const Table& table, Key key) {
    for (const auto& [k, name] : table)
        if (k == key) return name;
    return {};
}

template <class Key, size_t n>
Key keyIn(const std::pair<Key, const char*> (&table)[n], const std::string& wanted, const char* what) {
    if (wanted.empty()) return table[0].first;
    for (const auto& [k, name] : table)
        if (wanted == name) return k;
    throw CXException(kCXNetworkException, "The account's " + std::string(what) + " \"" + wanted + "\" is not known.");
}

std::optional<std::string> problemWithTemplate(const std::string& text, bool plainLoopback) {
    const auto e = parsedTemplate(text);
    if (!e)
        return "The endpoint \"" + text +
               "\" is not a URL with {user} as one path segment, such as https://dav.example.org/dav/{user}/Contacts.";
    if (e->scheme == "https") return std::nullopt;
    if (e->scheme != "http") return "The endpoint \"" + text + "\" is neither https nor http.";
    if (!plainLoopback || !isLoopbackHost(Url(originOf(*e) + "/").host()))
        return "The endpoint \"" + text +
               "\" is not encrypted. Use https; plain http is only for a store on a loopback address of this machine, "
               "and the account has to say so.";
    return std::nullopt;
}

} // namespace

bool isLoopbackHost(std::string_view host) {
    const std::string text(host);
    if (strcasecmp(text.c_str(), "localhost") == 0) return true;
    in_addr v4;
    if (inet_pton(AF_INET, text.c_str(), &v4) == 1) return (ntohl(v4.s_addr) >> 24) == 127;
    in6_addr v6;
    return inet_pton(AF_INET6, text.c_str(), &v6) == 1 && IN6_IS_ADDR_LOOPBACK(&v6);
}

std::optional<std::string> CXDAVAccount::problem() const {
    if (user.empty()) return "The account has no user name.";
    if (user == kSelf || !safeSegments("/" + Url::percentEncodeComponent(user.str())))
        return "\"" + user.str() + "\" cannot be a user name on a store.";
    if (auto p = problemWithTemplate(endpoint, plainLoopback)) return p;
    const bool plain = parsedTemplate(endpoint)->scheme == "http";
    if (plain && secureEndpoint.empty())
        return "The endpoint is plain http, but contacts are written over https only: give the https endpoint of the "
               "same store too.";
    if (!secureEndpoint.empty())
        if (auto p = problemWithTemplate(secureEndpoint, false)) return p;
    if (!Url::parse("http://" + effectiveNameHost() + "/") ||
        effectiveNameHost().find_first_of("/@?# ") != std::string::npos)
        return "\"" + nameHost + "\" is not a host name with an optional port.";
    if (passwordSource.kind != PasswordSource::Kind::none && passwordSource.value.empty())
        return "The account does not say which " + nameIn(kPasswordKinds, passwordSource.kind) + " gives the password.";
    if (!caFile.empty() && access(caFile.c_str(), R_OK) != 0)
        return "The authority's certificate file \"" + caFile + "\" cannot be read.";
    return std::nullopt;
}

std::string CXDAVAccount::defaultPath() {
    return configDirectory() + "/account.plist";
}

Dictionary CXDAVAccount::dictionary() const {
    return {{"user", user.str()},
            {"endpoint", endpoint},
            {"secureEndpoint", secureEndpoint},
            {"nameHost", nameHost},
            {"passwordSource", nameIn(kPasswordKinds, passwordSource.kind)},
            {"passwordFrom", passwordSource.value},
            {"authentication", nameIn(kAuthentications, authentication)},
            {"caFile", caFile},
            {"plainLoopback", plainLoopback}};
}

CXDAVAccount CXDAVAccount::fromDictionary(const Dictionary& d) {
    CXDAVAccount a;
    a.user = UserName(d["user"].string());
    a.endpoint = d["endpoint"].string();
    a.secureEndpoint = d["secureEndpoint"].string();
    a.nameHost = d["nameHost"].string();
    a.passwordSource.kind = keyIn(kPasswordKinds, d["passwordSource"].string(), "password source");
    a.passwordSource.value = d["passwordFrom"].string();
    a.authentication = keyIn(kAuthentications, d["authentication"].string(), "authentication");
    a.caFile = d["caFile"].string();
    a.plainLoopback = d["plainLoopback"].boolean();
    return a;
}

std::optional<CXDAVAccount> CXDAVAccount::load(const std::string& path) {
    const std::string file = path.empty() ? defaultPath() : path;
    if (access(file.c_str(), F_OK) != 0 && errno == ENOENT) return std::nullopt;
    try {
        CXDAVAccount a = fromDictionary(PropertyList::fromFile(file, {1u << 20, 8}).dictionary());
        if (auto p = a.problem()) throw CXException(kCXNetworkException, *p);
        return a;
    } catch (const CXException& e) {
        throw CXException(kCXNetworkException, "The account in " + file + " cannot be used: " + e.reason());
    }
}

void CXDAVAccount::save(const std::string& path) const {
    if (auto p = problem()) throw CXException(kCXNetworkException, *p);
    writeFileDurably(path.empty() ? defaultPath() : path, PropertyList::toXML(dictionary()), 0600);
}

std::string CXDAVAccount::password() const {
    return readPassword(passwordSource);
}

std::string CXDAVAccount::effectiveNameHost() const {
    if (!nameHost.empty()) return nameHost;
    const auto e = parsedTemplate(endpoint);
    return e ? e->authority : "";
}

Url CXDAVAccount::baseLocationFor(const UserName& who) const {
    return Url("http://" + effectiveNameHost() + "/" + Url::percentEncodeComponent(who.str()) + "/Contacts");
}

std::vector<std::string> CXDAVAccount::origins() const {
    std::vector<std::string> out;
    for (const std::string* text : {&endpoint, &secureEndpoint})
        if (const auto e = parsedTemplate(*text)) out.push_back(originOf(*e));
    return out;
}

struct EndpointMap::Impl {
    std::string nameHost;
    std::optional<Endpoint> usual, secure;             // `secure` is `usual` unless that is plain
    std::vector<std::pair<Endpoint, std::string>> all; // with their origins
};

EndpointMap::EndpointMap(const CXDAVAccount& account) : _impl(std::make_unique<Impl>()) {
    _impl->nameHost = account.effectiveNameHost();
    _impl->usual = parsedTemplate(account.endpoint);
    const auto other = parsedTemplate(account.secureEndpoint);
    _impl->secure = account.endpoint.starts_with("http:") ? other : _impl->usual;
    for (const auto& e : {_impl->usual, other})
        if (e) _impl->all.emplace_back(*e, originOf(*e));
}

EndpointMap::~EndpointMap() = default;

std::optional<Url> EndpointMap::endpointFor(const Url& name, bool securely) const {
    const auto& e = securely ? _impl->secure : _impl->usual;
    if (!e || !isHttp(name.scheme())) return std::nullopt;
    if (strcasecmp(authorityOf(name).c_str(), _impl->nameHost.c_str()) != 0) return std::nullopt;
    const auto segments = safeSegments(name.encodedPath());
    if (!segments || segments->size() < 2 || (*segments)[1] != "Contacts") return std::nullopt;
    std::string text = e->scheme + "://" + e->authority;
    appendSegments(text, e->before);
    appendSegments(text, {(*segments)[0]});
    appendSegments(text, e->after);
    appendSegments(text, {segments->begin() + 2, segments->end()});
    return Url::parse(text);
}

std::optional<Url> EndpointMap::nameFor(std::string_view href) const {
    std::string origin, path(href);
    if (!href.starts_with("/")) {
        const auto url = Url::parse(href);
        if (!url) return std::nullopt;
        origin = url->origin();
        path = url->encodedPath();
    } else if (href.starts_with("//") || href.find_first_of("?#") != std::string_view::npos) {
        return std::nullopt;
    }
    const auto segments = safeSegments(path);
    if (!segments) return std::nullopt;
    for (const auto& [e, itsOrigin] : _impl->all) {
        if (!origin.empty() && origin != itsOrigin) continue;
        const size_t userAt = e.before.size(), rest = userAt + 1 + e.after.size();
        if (segments->size() < rest || !std::equal(e.before.begin(), e.before.end(), segments->begin()) ||
            !std::equal(e.after.begin(), e.after.end(), segments->begin() + static_cast<long>(userAt) + 1))
            continue;
        std::string name = "http://" + _impl->nameHost;
        appendSegments(name, {(*segments)[userAt], "Contacts"});
        appendSegments(name, {segments->begin() + static_cast<long>(rest), segments->end()});
        return Url::parse(name);
    }
    return std::nullopt;
}

std::optional<Url> CXDAVAccount::endpointFor(const Url& name, bool securely) const {
    return EndpointMap(*this).endpointFor(name, securely);
}

std::optional<Url> CXDAVAccount::nameFor(std::string_view href) const {
    return EndpointMap(*this).nameFor(href);
}

} // namespace rolvane
