#pragma once

#include "foundation/CXException.h"
#include "foundation/Url.h"

#include <cstdint>
#include <stdexcept>
#include <string>

namespace rolvane::fuzz {

inline void checkComponent(const Url& base, const std::string& component) {
    if (component.empty()) return;
    Url below;
    try {
        below = base.cxURLByAppendingComponent(component);
    } catch (const CXException&) {
        throw std::logic_error("a component was refused");
    }
    if (below.cxLastComponent() != component) throw std::logic_error("a component is another one in its address");
    if (below.origin() != base.origin()) throw std::logic_error("a component leads to another server");
    if (below.pathComponents().size() != base.pathComponents().size() + 1)
        throw std::logic_error("a component is not one component");
    if (Url::parse(below.absoluteString()) != below) throw std::logic_error("an address was made that is none");
}

// Any text is an address or none: an address is kept to the letter, names one server, and a name that is put into it or
// taken out of it stays one name. Throws std::logic_error when that does not hold.
inline void checkAddress(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    if (Url::percentDecode(Url::percentEncodeComponent(text)) != text)
        throw std::logic_error("what was encoded decodes to something else");
    const Url store("https://dav.example.org/dav/alice");
    checkComponent(store, text);
    const auto url = Url::parse(text);
    if (!url) return;
    if (url->absoluteString() != text) throw std::logic_error("an address is not kept");
    for (const unsigned char c : text)
        if (c <= ' ' || c >= 0x7f) throw std::logic_error("an address holds what none may hold");
    if (const auto scheme = url->scheme(); (scheme == "http" || scheme == "https") && url->host().empty())
        throw std::logic_error("a web address without a server");
    if (const auto port = url->port(); port && (*port < 0 || *port > 65535)) throw std::logic_error("no port");
    for (const std::string& component : url->pathComponents())
        if (component.empty()) throw std::logic_error("an empty component");
    if (url->host() == "dav.example.org" && url->scheme() == "https" && !url->port() && url->origin() != store.origin())
        throw std::logic_error("one server has two origins");
    try {
        const std::string path = url->filePath();
        if (path.empty() || path[0] != '/' || (path + "/").find("/../") != std::string::npos ||
            path.find('\0') != std::string::npos)
            throw std::logic_error("a file address leaves its directory");
    } catch (const CXException&) { // no file of this machine
    }
    checkComponent(Url("https://dav.example.org/"), url->cxLastComponent());
    url->cxURLByDeletingLastComponent();
}

} // namespace rolvane::fuzz
