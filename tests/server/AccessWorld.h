#pragma once

#include "RawHttp.h"
#include "StoreTestWorld.h"

#include <string>
#include <vector>

namespace rolvane {

// How users are known there: by Basic from a text file as usual, by Basic from a DBM file and nothing else, by Digest.
// And as usual with a module that was built with AddressSanitizer and UndefinedBehaviorSanitizer.
enum class AccessVariant { usual, dbm, digest, sanitized };

// A private store on plain HTTP with the users alice (who owns the tree /dav/alice/Contacts), walter (may write it),
// rita (may read it), sam (a stranger with a tree of his own) and greta (a member of the group readers, which may
// read).
class AccessWorld {
public:
    explicit AccessWorld(AccessVariant variant = AccessVariant::usual, PrivateStoreOptions options = {});
    explicit AccessWorld(PrivateStoreOptions options) : AccessWorld(AccessVariant::usual, std::move(options)) {}
    ~AccessWorld(); // fails the test when a sanitizer had something to say

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

    const AccessVariant variant;
    StoreDirectory directory;
    PrivateStore store;

private:
    void makeUsers();
    mutable std::string _nonce; // the server's, for Digest
};

} // namespace rolvane
