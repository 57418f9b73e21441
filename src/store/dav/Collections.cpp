#include "store/dav/Collections.h"

#include <algorithm>
#include <utility>

namespace rolvane {

namespace {

constexpr size_t kTreeComponents = 3; // "/", user, "Contacts"

bool isNumber(const std::string& text) {
    return !text.empty() && text.find_first_not_of("0123456789") == std::string::npos;
}

// The reference as it resolves against the URL (RFC 3986 section 5.2): whole URLs, and paths from the root. Nothing for
// the forms that no server uses for this.
std::optional<Url> resolved(const Url& against, const std::string& reference) {
    if (reference.starts_with("//")) return Url::parse(against.scheme() + ":" + reference);
    if (!reference.starts_with('/')) return Url::parse(reference);
    const std::string& text = against.absoluteString();
    const size_t authority = text.find("//");
    if (authority == std::string::npos) return std::nullopt;
    return Url::parse(text.substr(0, text.find('/', authority + 2)) + reference);
}

} // namespace

Url namedAsCollection(const Url& url) {
    const std::string& text = url.absoluteString();
    return text.ends_with('/') ? url : Url(text + "/");
}

bool isAlwaysCollection(const Url& name) {
    const auto components = name.pathComponents();
    if (components.size() == kTreeComponents) return true;
    if (components.size() < kTreeComponents || components[kTreeComponents] != "People") return false;
    return components.size() == kTreeComponents + 1 ||
           (components.size() == kTreeComponents + 2 && isNumber(components.back()));
}

std::string redirectTarget(const Url& asked, const HttpResponse& answer) {
    if (!answer.complete() || answer.status < 300 || answer.status >= 400) return {};
    const std::string* location = answer.header("location");
    if (!location) return {};
    const auto url = resolved(asked, *location);
    return url ? url->absoluteString() : *location;
}

std::optional<Url> redirectToCollection(const Url& asked, const HttpResponse& answer) {
    const int status = answer.status;
    const bool sameMethod = status == 301 || status == 302 || status == 307 || status == 308;
    const auto target = sameMethod ? Url::parse(redirectTarget(asked, answer)) : std::nullopt;
    if (!target || target->origin() != asked.origin()) return std::nullopt;
    const bool addsSlash = !asked.encodedPath().ends_with('/') && target->encodedPath().ends_with('/');
    const bool isPlain = target->absoluteString().find_first_of("?#") == std::string::npos;
    if (!addsSlash || !isPlain || target->pathComponents() != asked.pathComponents()) return std::nullopt;
    return namedAsCollection(asked);
}

HttpRequest sentTo(HttpRequest request, const Url& place) {
    const std::string former = "<" + request.url.absoluteString() + ">";
    for (auto& [name, value] : request.headers)
        if (name == "If" && value.starts_with(former))
            value.replace(0, former.size(), "<" + place.absoluteString() + ">");
    request.url = place;
    return request;
}

} // namespace rolvane
