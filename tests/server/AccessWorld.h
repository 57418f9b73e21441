#pragma once

#include "RawHttp.h"
#include "StoreTestWorld.h"

#include <string>
#include <vector>

namespace rolvane {

// A private store on plain HTTP with the users alice (who owns the tree /dav/alice/Contacts), walter (may write it),
// rita (may read it), sam (a stranger with a tree of his own) and greta (a member of the group readers, which may
// read).
class AccessWorld {
public:
    explicit AccessWorld(PrivateStoreOptions options = {});

    // A Destination may be given as a path.
    RawAnswer ask(const std::string& user, const std::string& method, const std::string& path,
                  std::vector<std::pair<std::string, std::string>> headers = {}, const std::string& body = {}) const;
    int status(const std::string& user, const std::string& method, const std::string& path,
               std::vector<std::pair<std::string, std::string>> headers = {}, const std::string& body = {}) const {
        return ask(user, method, path, std::move(headers), body).status;
    }
    // Makes alice's tree as it is described above, with its lists, whatever was there before.
    void reset() const;

    int port() const { return store.status().port; }
    std::string listFile(const std::string& owner) const { return store.stateDirectory() + "/lists/" + owner + ".acl"; }

    static std::string ace(const std::string& principal, const std::string& privileges, const std::string& more = {});
    static std::string user(const std::string& name) { return "<D:href>/principals/users/" + name + "</D:href>"; }
    static std::string group(const std::string& name) { return "<D:href>/principals/groups/" + name + "</D:href>"; }
    static std::string acl(const std::string& aces) { return "<D:acl xmlns:D=\"DAV:\">" + aces + "</D:acl>"; }
    static std::string lists(); // what reset() sets
    static std::string propfind(const std::string& names);
    static const std::string kLock, kPatch;

    StoreDirectory directory;
    PrivateStore store;
};

} // namespace rolvane
