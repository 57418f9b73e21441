#include "store/dav/StorePrincipals.h"

#include "store/dav/CXDAVNode.h"
#include "store/dav/Collections.h"

#include <algorithm>

namespace rolvane {
namespace {

constexpr const char* kBody = "<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:propfind xmlns:D=\"DAV:\"><D:prop>"
                              "<D:resourcetype/><D:displayname/></D:prop></D:propfind>";

// A name that stays one path component, whatever a server makes of escapes.
bool isAComponent(const std::string& name) {
    return !name.empty() && name != "." && name != ".." && std::none_of(name.begin(), name.end(), [](unsigned char c) {
        return c == '/' || c == '\\' || c < 0x20 || c == 0x7f;
    });
}

bool isPrincipal(const CXDAVNode& response) {
    const CXDAVNode* type = davProperty(response, "resourcetype");
    return type && type->firstChild("principal");
}

} // namespace

StorePrincipals::StorePrincipals(StoreSession& session, Url asked, const std::string& itself,
                                 const std::vector<std::string>& collections)
    : _session(session), _asked(std::move(asked)) {
    if (const auto url = Url::parse(itself);
        url && !url->host().empty() && url->pathComponents() == _asked.pathComponents())
        _innerOrigin = url->origin();
    for (const std::string& href : collections)
        if (const auto url = resolved(href)) _collections.push_back(*url);
}

std::optional<Url> StorePrincipals::resolved(const std::string& href) const {
    if (href.starts_with("//")) return std::nullopt;
    const auto url = Url::parse(href.starts_with('/') ? _asked.origin() + href : href);
    if (!url || url->host().empty()) return std::nullopt;
    if (url->origin() == _asked.origin()) return url;
    return url->origin() == _innerOrigin ? Url::parse(_asked.origin() + url->encodedPath()) : std::nullopt;
}

std::string StorePrincipals::nameFor(const std::string& href) const {
    const auto url = resolved(href);
    const std::string name = url ? url->cxLastComponent() : std::string();
    return isAComponent(name) ? name : std::string();
}

void StorePrincipals::learn(const std::string& href) {
    if (const std::string name = nameFor(href); !name.empty()) _known.emplace(name, href);
}

StorePrincipals::Answer StorePrincipals::lookAt(const Url& place, int depth, const std::string& name,
                                                std::string& href) {
    HttpRequest request = StoreSession::propfind(place, depth);
    request.body = std::make_shared<const std::string>(kBody);
    request.limits.maxBodyBytes = 8u << 20;
    const HttpResponse answer = _session.send(std::move(request), [](int) { return true; });
    if (answer.status == 404) return Answer::notThere;
    const auto root = answer.status == 207 ? parseDAVTree(answer.body) : std::nullopt;
    const auto responses = root ? davResponses(*root) : std::nullopt;
    if (!responses) return Answer::silent;
    for (const CXDAVNode* response : *responses) {
        const CXDAVNode* where = response->firstChild("href");
        if (!where || !isPrincipal(*response) || !resolved(where->content())) continue;
        const CXDAVNode* shown = davProperty(*response, "displayname");
        if (depth != 0 && nameFor(where->content()) != name && (!shown || shown->content() != name)) continue;
        href = where->content();
        return Answer::found;
    }
    return Answer::notThere;
}

std::optional<std::string> StorePrincipals::hrefFor(const std::string& name) {
    if (const auto known = _known.find(name); known != _known.end()) return known->second;
    if (!isAComponent(name) || _collections.empty()) return std::nullopt;
    std::string href;
    bool answered = false;
    for (const Url& collection : _collections)
        if (lookAt(collection.cxURLByAppendingComponent(name), 0, name, href) == Answer::found)
            return _known[name] = href;
    for (const Url& collection : _collections) {
        const Answer answer = lookAt(namedAsCollection(collection), 1, name, href);
        if (answer == Answer::found) return _known[name] = href;
        answered = answered || answer == Answer::notThere;
    }
    if (answered) return std::nullopt;
    return _known[name] = _collections.front().cxURLByAppendingComponent(name).encodedPath();
}

} // namespace rolvane
