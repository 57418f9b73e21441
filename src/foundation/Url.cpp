#include "foundation/Url.h"

#include "foundation/CXException.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <fmt/format.h>

namespace rolvane {

namespace {

constexpr std::string_view kHexDigits = "0123456789ABCDEF";

constexpr bool isAlpha(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}
constexpr bool isDigit(char c) {
    return c >= '0' && c <= '9';
}
constexpr bool isUnreserved(char c) {
    return isAlpha(c) || isDigit(c) || c == '-' || c == '.' || c == '_' || c == '~';
}
constexpr std::array<bool, 256> kUrlCharacters = [] {
    std::array<bool, 256> all{};
    for (const char c : std::string_view(":/?#[]@!$&'()*+,;=%")) all[static_cast<uint8_t>(c)] = true;
    for (int c = 0; c < 128; ++c)
        if (isUnreserved(static_cast<char>(c))) all[static_cast<size_t>(c)] = true;
    return all;
}();
bool isUrlCharacter(char c) {
    return kUrlCharacters[static_cast<uint8_t>(c)];
}

int hexValue(char c) {
    if (isDigit(c)) return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

bool isEscapeAt(std::string_view text, size_t i) {
    return i + 2 < text.size() && hexValue(text[i + 1]) >= 0 && hexValue(text[i + 2]) >= 0;
}

std::string lowerCase(std::string_view text) {
    std::string out(text);
    std::transform(out.begin(), out.end(), out.begin(),
                   [](char c) { return c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c; });
    return out;
}

// The parts of a URL as they stand in its text (RFC 3986, section 3). `head` is all before the path.
struct Parts {
    std::string_view head, scheme, authority, path;
    bool hasAuthority = false;
};

Parts split(std::string_view text) {
    Parts p;
    const size_t colon = text.find(':');
    if (colon == std::string_view::npos) return p; // the empty URL
    p.scheme = text.substr(0, colon);
    size_t at = colon + 1;
    // Two searches for one character take a tenth of the time of one for both.
    const size_t tail = std::min({text.find('?', at), text.find('#', at), text.size()});
    if (text.substr(at, 2) == "//") {
        const size_t end = std::min(text.find('/', at + 2), tail);
        p.authority = text.substr(at + 2, end - at - 2);
        p.hasAuthority = true;
        at = end;
    }
    p.head = text.substr(0, at);
    p.path = text.substr(at, tail - at);
    return p;
}

// An authority's host with its brackets if any, and its port's text (RFC 3986, section 3.2).
struct HostAndPort {
    std::string_view host, port;
};

HostAndPort splitAuthority(std::string_view authority) {
    if (const size_t at = authority.rfind('@'); at != std::string_view::npos) authority.remove_prefix(at + 1);
    size_t hostEnd = 0;
    if (!authority.empty() && authority[0] == '[') hostEnd = std::min(authority.find(']'), authority.size());
    const size_t colon = authority.find(':', hostEnd);
    if (colon == std::string_view::npos) return {authority, {}};
    return {authority.substr(0, colon), authority.substr(colon + 1)};
}

std::optional<int> portNumber(std::string_view text) {
    int n = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), n);
    if (text.empty() || error != std::errc() || end != text.data() + text.size() || n < 0 || n > 65535)
        return std::nullopt;
    return n;
}

bool isScheme(std::string_view s) {
    return !s.empty() && isAlpha(s[0]) && std::all_of(s.begin(), s.end(), [](char c) {
        return isAlpha(c) || isDigit(c) || c == '+' || c == '-' || c == '.';
    });
}

bool isHost(std::string_view host) {
    if (host.empty() || host[0] != '[') return host.find_first_of("[]:@") == std::string_view::npos;
    if (host.size() < 4 || host.back() != ']') return false;
    const std::string_view inside = host.substr(1, host.size() - 2);
    return std::all_of(inside.begin(), inside.end(), [](char c) { return hexValue(c) >= 0 || c == ':' || c == '.'; });
}

bool isAuthority(std::string_view authority) {
    if (std::count(authority.begin(), authority.end(), '@') > 1) return false;
    const auto [host, port] = splitAuthority(authority);
    return isHost(host) && (port.empty() || portNumber(port));
}

bool hasOnlyUrlCharacters(std::string_view text) {
    for (size_t i = 0; i < text.size(); ++i)
        if (!isUrlCharacter(text[i]) || (text[i] == '%' && !isEscapeAt(text, i))) return false;
    return true;
}

bool needsHost(std::string_view scheme) {
    const std::string s = lowerCase(scheme);
    return s == "http" || s == "https";
}

bool isUrl(std::string_view text) {
    if (!hasOnlyUrlCharacters(text)) return false;
    const Parts p = split(text);
    if (!isScheme(p.scheme) || p.path.find_first_of("[]") != std::string_view::npos) return false;
    if (p.hasAuthority && !isAuthority(p.authority)) return false;
    return !needsHost(p.scheme) || !splitAuthority(p.authority).host.empty();
}

std::string_view withoutTrailingSlashes(std::string_view path) {
    while (!path.empty() && path.back() == '/') path.remove_suffix(1);
    return path;
}

std::string_view lastSegment(std::string_view path) {
    path = withoutTrailingSlashes(path);
    return path.substr(path.rfind('/') + 1); // npos + 1 is 0
}

// "." and ".." are unreserved characters only, and would be taken for the directory and its parent.
std::string encodedSegment(std::string_view component) {
    if (component == ".") return "%2E";
    if (component == "..") return "%2E%2E";
    return Url::percentEncodeComponent(component);
}

bool isSafeFileName(std::string_view name) {
    return name != "." && name != ".." && name.find('/') == std::string_view::npos &&
           name.find('\0') == std::string_view::npos;
}

} // namespace

std::optional<Url> Url::parse(std::string_view text) {
    if (!isUrl(text)) return std::nullopt;
    Url url;
    url._text = text;
    return url;
}

Url::Url(std::string_view text) {
    if (!isUrl(text))
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("\"{}\" is not a URL: check the scheme, the host and that special characters "
                                      "are written as %XX",
                                      text));
    _text = text;
}

Url Url::fileURL(std::string_view path) {
    if (path.empty() || path[0] != '/')
        throw CXException(kCXInvalidArgumentException, fmt::format("\"{}\" is not an absolute path", path));
    std::string text = "file:";
    for (size_t at = path.find_first_not_of('/'); at != std::string_view::npos;) {
        const size_t end = std::min(path.find('/', at), path.size());
        text += '/' + encodedSegment(path.substr(at, end - at));
        at = path.find_first_not_of('/', end);
    }
    if (path.back() == '/') text += '/';
    return Url(text);
}

std::string Url::scheme() const {
    return std::string(split(_text).scheme);
}

std::string Url::host() const {
    std::string_view host = splitAuthority(split(_text).authority).host;
    if (!host.empty() && host[0] == '[') host = host.substr(1, host.size() - 2);
    return std::string(host);
}

std::optional<int> Url::port() const {
    return portNumber(splitAuthority(split(_text).authority).port);
}

std::string Url::origin() const {
    const Parts p = split(_text);
    const auto [host, portText] = splitAuthority(p.authority);
    const std::string scheme = lowerCase(p.scheme);
    std::optional<int> number = portNumber(portText);
    if (!number && scheme == "http") number = 80;
    if (!number && scheme == "https") number = 443;
    std::string out = scheme + "://" + lowerCase(host);
    if (number) out += ':' + std::to_string(*number);
    return out;
}

std::string Url::encodedPath() const {
    return std::string(split(_text).path);
}
std::string Url::path() const {
    return percentDecode(split(_text).path);
}

std::vector<std::string> Url::pathComponents() const {
    const std::string_view path = split(_text).path;
    std::vector<std::string> components;
    if (!path.empty() && path[0] == '/') components.emplace_back("/");
    for (size_t at = path.find_first_not_of('/'); at != std::string_view::npos;) {
        const size_t end = std::min(path.find('/', at), path.size());
        components.push_back(percentDecode(path.substr(at, end - at)));
        at = path.find_first_not_of('/', end);
    }
    return components;
}

std::string Url::cxLastComponent() const {
    return percentDecode(lastSegment(split(_text).path));
}

Url Url::cxURLByAppendingComponent(std::string_view component) const {
    if (component.empty() || _text.empty())
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("\"{}\" cannot be appended to the URL \"{}\": one is empty", component, _text));
    const Parts p = split(_text);
    const std::string_view path = withoutTrailingSlashes(p.path);
    const bool rootless = p.path.empty() && !p.hasAuthority;
    Url url;
    url._text.append(p.head).append(path).append(rootless ? "" : "/").append(encodedSegment(component));
    return url;
}

Url Url::cxURLByDeletingLastComponent() const {
    const Parts p = split(_text);
    std::string_view path = withoutTrailingSlashes(p.path);
    path.remove_suffix(lastSegment(path).size());
    path = withoutTrailingSlashes(path);
    if (path.empty() && !p.path.empty() && p.path[0] == '/') path = "/";
    Url url;
    url._text.append(p.head).append(path);
    return url;
}

std::string Url::filePath() const {
    const Parts p = split(_text);
    const std::string onHost = lowerCase(splitAuthority(p.authority).host);
    const std::vector<std::string> components = pathComponents();
    const bool local = lowerCase(p.scheme) == "file" && (onHost.empty() || onHost == "localhost");
    if (!local || components.empty() || components[0] != "/" ||
        !std::all_of(components.begin() + 1, components.end(), isSafeFileName))
        throw CXException(kCXInvalidArgumentException, fmt::format("\"{}\" does not name a local file", _text));
    std::string path;
    for (size_t i = 1; i < components.size(); ++i) path += '/' + components[i];
    return path.empty() ? "/" : path;
}

Url Url::withScheme(std::string_view scheme) const {
    return Url(std::string(scheme) + _text.substr(split(_text).scheme.size()));
}

std::string Url::percentDecode(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%' || !isEscapeAt(text, i)) {
            out += text[i];
            continue;
        }
        out += static_cast<char>(hexValue(text[i + 1]) * 16 + hexValue(text[i + 2]));
        i += 2;
    }
    return out;
}

std::string Url::percentEncodeComponent(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (const char c : text) {
        if (isUnreserved(c)) {
            out += c;
            continue;
        }
        const auto byte = static_cast<unsigned char>(c);
        out += '%';
        out += kHexDigits[byte >> 4];
        out += kHexDigits[byte & 15];
    }
    return out;
}

} // namespace rolvane
