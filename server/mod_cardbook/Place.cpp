#include "server/mod_cardbook/Place.h"

#include "foundation/Utf8.h"

#include <algorithm>
#include <vector>

namespace rolvane::cardbook {
namespace {

constexpr size_t kLongestName = 255;

std::vector<std::string> segmentsOf(std::string_view path) {
    std::vector<std::string> all;
    while (!path.empty()) {
        const size_t slash = std::min(path.find('/'), path.size());
        if (slash > 0) all.emplace_back(path.substr(0, slash));
        path.remove_prefix(std::min(slash + 1, path.size()));
    }
    return all;
}

int hexDigit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

std::optional<std::string> unescaped(std::string_view text) {
    std::string out;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] != '%') {
            out += text[i];
            continue;
        }
        const int high = i + 2 < text.size() ? hexDigit(text[i + 1]) : -1;
        const int low = i + 2 < text.size() ? hexDigit(text[i + 2]) : -1;
        if (high < 0 || low < 0 || (high == 0 && low == 0)) return std::nullopt;
        out += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return out;
}

} // namespace

std::optional<Place> placeOf(std::string_view base, std::string_view path) {
    if (!path.starts_with(base)) return std::nullopt;
    path.remove_prefix(base.size());
    if (!path.empty() && path.front() != '/') return std::nullopt;
    const bool isCollection = path.ends_with('/');
    const std::vector<std::string> parts = segmentsOf(path);
    if (parts.empty()) return Place{Place::Kind::root, {}, {}};
    if (parts[0] == "principal" && parts.size() == 1) return Place{Place::Kind::principal, {}, {}};
    if (parts[0] != "home") return Place{};
    if (parts.size() == 1) return Place{Place::Kind::home, {}, {}};
    if (parts.size() == 2) return Place{Place::Kind::book, parts[1], {}};
    if (parts.size() == 3 && !isCollection) return Place{Place::Kind::card, parts[1], parts[2]};
    return Place{};
}

std::string pathOf(std::string_view base, const Place& place) {
    const std::string start(base);
    switch (place.kind) {
    case Place::Kind::principal: return start + "/principal/";
    case Place::Kind::home: return start + "/home/";
    case Place::Kind::book: return start + "/home/" + place.book + "/";
    case Place::Kind::card: return start + "/home/" + place.book + "/" + place.name;
    default: return start + "/";
    }
}

std::string escapedPath(std::string_view path) {
    constexpr std::string_view kPlain = "-._~!$'()*+,;=:@/";
    constexpr char kDigits[] = "0123456789ABCDEF";
    std::string out;
    for (const char c : path) {
        const auto byte = static_cast<unsigned char>(c);
        const bool isLetter = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
        if (isLetter || kPlain.find(c) != std::string_view::npos)
            out += c;
        else
            out.append({'%', kDigits[byte >> 4], kDigits[byte & 15]});
    }
    return out;
}

std::optional<std::string> pathOfHref(std::string_view href) {
    for (const std::string_view scheme : {"http://", "https://"}) {
        if (!href.starts_with(scheme)) continue;
        href.remove_prefix(scheme.size());
        href.remove_prefix(std::min(href.find('/'), href.size()));
    }
    if (!href.starts_with('/')) return std::nullopt;
    return unescaped(href.substr(0, href.find_first_of("?#")));
}

bool isUsableName(std::string_view name) {
    if (name.empty() || name.size() > kLongestName || name == "." || name == ".." || !isUtf8(name)) return false;
    return std::none_of(name.begin(), name.end(), [](char c) { return c == '/' || c == 0x7f || (c >= 0 && c < 0x20); });
}

} // namespace rolvane::cardbook
