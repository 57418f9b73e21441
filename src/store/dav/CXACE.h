#pragma once

#include "store/dav/CXDAVNode.h"

#include <optional>
#include <set>
#include <string>

namespace rolvane {

// One entry of an access list (RFC 3744 section 5.5.1), or the privileges that the current user has somewhere
// (section 5.4), which is an entry for that user. A plain value.
class CXACE {
public:
    enum class Principal {
        href,            // one principal, see `href`
        all,             // everybody
        authenticated,   // everybody who is signed in
        unauthenticated, // everybody who is not
        property,        // whom a property of the resource names: its owner, mostly
        self             // the current user, or the resource itself where it is a principal
    };

    // Nothing when the node is no DAV:current-user-privilege-set or holds no privilege.
    static std::optional<CXACE> initWithCurrentUserPrivNode(const CXDAVNode& node);
    // Nothing when the node is no DAV:ace or has not exactly one principal and one list of privileges.
    static std::optional<CXACE> initWithACENode(const CXDAVNode& node);

    Principal principal() const { return _principal; }
    const std::string& href() const { return _href; }                   // as the server wrote it, "" for other kinds
    bool isGrant() const { return _grant; }                             // else it denies
    bool isInverted() const { return _inverted; }                       // it is for everybody but the principal
    bool isProtected() const { return _protected; }                     // the server's own, never sent back
    bool isInherited() const { return _inherited; }                     // it belongs to another resource's list
    const std::string& inheritedFrom() const { return _inheritedFrom; } // that resource's href, "" when none is named
    const std::set<std::string>& privileges() const { return _privileges; } // names in DAV:, "{uri}name" others

    // What the privileges hold, whether they are granted or denied. An aggregate holds its parts (RFC 3744 section 3);
    // all the parts of DAV:write together are as good as DAV:write.
    bool canRead() const;
    bool canWrite() const;
    bool canWriteSomething() const; // a part of writing at least
    // Nothing but what reading and writing consist of.
    bool isPlain() const;

    std::string xml() const { return _node.xml(); } // the entry as it came

private:
    void addPrivilegesIn(const CXDAVNode& node);

    CXDAVNode _node;
    Principal _principal = Principal::self;
    std::string _href, _inheritedFrom;
    bool _grant = true, _inverted = false, _protected = false, _inherited = false;
    std::set<std::string> _privileges;
};

} // namespace rolvane
