#pragma once

#include "foundation/Mutex.h"
#include "foundation/Url.h"
#include "store/dav/CXACE.h"
#include "store/http/StoreSession.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class StorePrincipals;

// The account names on an access list: who may read, and who may do everything. In order, without duplicates, and
// without those from whom an entry before theirs takes it.
struct AccessLists {
    std::vector<std::string> readers, writers;
    friend bool operator==(const AccessLists&, const AccessLists&) = default;
};

// Reads and sets the access lists of a store (RFC 3744: the property DAV:acl and the method ACL). Any thread.
//
// A list on the store is more than the two lists of names: the owner's own entry, entries for groups or for everybody,
// denials. All those stay as they are and in their order. Ours are the grants of plain reading and writing to single
// principals other than the owner; those are replaced.
//
// Several programs of one owner may set one list. So a list that this client has seen is changed by what the caller
// changed since then, and what others changed meanwhile stays; and a list that the caller did not change is not sent.
//
// Some servers keep one list for all of an owner's tree, at its root. A place below has no entries of its own then:
// what it inherits is read in their stead, and where the server refuses a list for the place itself, the one that it
// inherits from is set, if that is the place's own parent and belongs to the same owner.
class StoreAccessLists {
public:
    explicit StoreAccessLists(StoreSession& session) : _session(session) {}

    // Nothing when the store keeps none there, does not show them, or gives no whole answer.
    std::optional<AccessLists> read(const Url& name, bool securely);
    // True when the list holds what was asked for, but for names that the store does not know: those are logged, the
    // others are set all the same, and the result is false. Nothing is sent when the list cannot be read first.
    bool set(const Url& name, bool securely, const AccessLists& wanted);

private:
    struct OnStore;
    std::optional<Url> placeOf(const Url& name, bool securely) const;
    std::optional<OnStore> fetch(const Url& endpoint);
    std::optional<OnStore> fetchParent(const OnStore& below);
    AccessLists listsOf(const OnStore& found) const;
    bool isOurs(const OnStore& found, const CXACE& ace) const;
    static bool dropUnknown(const Url& name, OnStore& found, std::vector<std::string>& list);
    std::string entriesWith(const OnStore& found, const AccessLists& wanted) const;
    HttpResponse send(OnStore& found, const AccessLists& wanted);
    bool sendOrInherit(const Url& name, OnStore& found, const AccessLists& wanted);

    StoreSession& _session;
    Mutex _mutex;
    std::map<std::string, AccessLists> _known GUARDED_BY(_mutex); // by name: what the caller has seen or set last
};

} // namespace rolvane
