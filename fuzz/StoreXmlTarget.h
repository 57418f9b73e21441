#pragma once

#include "store/dav/CXACE.h"
#include "store/dav/CXDAVNode.h"
#include "store/dav/Multistatus.h"

#include <algorithm>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <string_view>

namespace rolvane::fuzz {

inline std::string withoutBlanks(std::string_view text) {
    std::string out;
    for (const char c : text)
        if (c != ' ' && c != '\t' && c != '\r' && c != '\n') out += c;
    return out;
}

inline bool isSame(const MultistatusEntry& a, const MultistatusEntry& b) {
    return a.href == b.href && a.status == b.status && a.isCollection == b.isCollection &&
           a.lastModified == b.lastModified && a.length == b.length && a.etag == b.etag && a.membersTag == b.membersTag;
}

inline bool isSame(const CXDAVNode& a, const CXDAVNode& b) {
    return a.isText() == b.isText() && a.string() == b.string() &&
           std::equal(a.children().begin(), a.children().end(), b.children().begin(), b.children().end(),
                      [](const CXDAVNode& x, const CXDAVNode& y) { return isSame(x, y); });
}

// A listing reads the same whatever the pieces in which it comes, and has the responses that the tree of the same text
// has, under the same names.
inline void checkListing(std::string_view text, const std::optional<CXDAVNode>& tree) {
    MultistatusReader whole, inPieces;
    whole.feed(text);
    for (size_t at = 0, step = 1; at < text.size(); at += step, step = 1 + (step * 7 + at) % 61)
        inPieces.feed(text.substr(at, step));
    const auto entries = whole.finish();
    const auto again = inPieces.finish();
    if (entries.has_value() != again.has_value()) throw std::logic_error("a listing depends on how it is cut");
    if (!entries) return;
    if (!std::equal(entries->begin(), entries->end(), again->begin(), again->end(),
                    [](const MultistatusEntry& a, const MultistatusEntry& b) { return isSame(a, b); }))
        throw std::logic_error("the entries of a listing depend on how it is cut");
    const auto responses = tree ? davResponses(*tree) : std::nullopt;
    if (!responses) return;
    if (responses->size() != entries->size()) throw std::logic_error("a listing has another number of responses");
    for (size_t i = 0; i < entries->size(); ++i) {
        const auto hrefs = (*responses)[i]->childNodesMatchingString("href");
        if (hrefs.size() == 1 && hrefs[0]->childCount() == 1 &&
            withoutBlanks(hrefs[0]->content()) != withoutBlanks((*entries)[i].href))
            throw std::logic_error("a listing has another name");
    }
}

inline void checkLocks(std::string_view text) {
    parseLockDiscovery(text);
    const auto grant = parseLockAnswer(text);
    if (!grant) return;
    std::string body = "<D:prop xmlns:D=\"DAV:\"><D:lockdiscovery><D:activelock><D:owner>" +
                       CXDAVNode::escaped(grant->owner) + "</D:owner>";
    if (grant->timeoutSeconds)
        body += "<D:timeout>Second-" + std::to_string(static_cast<uint64_t>(*grant->timeoutSeconds)) + "</D:timeout>";
    if (!grant->token.empty())
        body += "<D:locktoken><D:href>" + CXDAVNode::escaped(grant->token.str()) + "</D:href></D:locktoken>";
    const auto again = parseLockAnswer(body + "</D:activelock></D:lockdiscovery></D:prop>");
    if (!again || again->token != grant->token || again->timeoutSeconds != grant->timeoutSeconds ||
        withoutBlanks(again->owner) != withoutBlanks(grant->owner))
        throw std::logic_error("a lock that was written reads back as another one");
}

inline void checkEntries(const CXDAVNode& node) {
    if (const auto ace = CXACE::initWithACENode(node)) {
        const auto tree = parseDAVTree(ace->xml());
        const auto again = tree ? CXACE::initWithACENode(tree->childAtIndex(0).childAtIndex(0)) : std::nullopt;
        if (!again || again->principal() != ace->principal() || again->isGrant() != ace->isGrant() ||
            again->isInverted() != ace->isInverted() || again->isProtected() != ace->isProtected() ||
            again->isInherited() != ace->isInherited() || again->canRead() != ace->canRead() ||
            again->canWrite() != ace->canWrite() || withoutBlanks(again->href()) != withoutBlanks(ace->href()))
            throw std::logic_error("an entry that was sent back is another one");
    }
    CXACE::initWithCurrentUserPrivNode(node);
    for (const CXDAVNode& child : node.children()) checkEntries(child);
}

// Any text that a store may answer with: read as a listing, as what it says of locks, and as a tree with the entries
// of access lists. Throws std::logic_error when two ways of reading it differ.
inline void checkStoreXml(const uint8_t* data, size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    const auto tree = parseDAVTree(text);
    checkListing(text, tree);
    checkLocks(text);
    if (!tree) return;
    const auto once = parseDAVTree(tree->childAtIndex(0).childAtIndex(0).xml());
    const auto twice = once ? parseDAVTree(once->childAtIndex(0).childAtIndex(0).xml()) : std::nullopt;
    if (!twice || !isSame(*once, *twice)) throw std::logic_error("a tree that was written reads back as another one");
    checkEntries(*tree);
}

} // namespace rolvane::fuzz
