#pragma once

#include "acl/CXACLManager.h"
#include "store/dav/CXACE.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXDAVManager;
class CXDAVNode;

// The access list of a base location on the network store. The owner's own list is read and set there. Of a location
// that somebody else published, the server is asked what the current user may do: the lists then hold "<self>" or
// nobody. One thread at a time; operations wait for the server.
//
// What the owner grants or denies is kept until a `save` has carried it. While the list could not be read it is carried
// out on what that `save` reads: a list that was never seen is not replaced.
//   change = { "principal": string, "allAccess", "grant", "oneListOnly": boolean }
class CXDAVACLManager final : public CXACLManager {
public:
    // The namespace of the store's own elements.
    static constexpr const char* kStoreNamespace = "http://rolvane.net/ns/";

    // Loads. The client is borrowed and outlives the manager.
    CXDAVACLManager(Url baseLocation, const LocationOwner& owner, CXDAVManager& manager);

    bool load() override; // false: nothing could be read, and the lists are as they were
    // True without a request for somebody else's location; else whether the list is on the store.
    bool save() override;
    Array unsaved() const override;
    void resume(const Array& changes) override;
    // Whose rights such changes take away; in order, each name once.
    static std::vector<UserName> deniedIn(const Array& changes);
    // False: the owner's list could not be read yet. What cannot be read of somebody else's location is no access.
    bool isKnown() const override { return _loaded || !_publisher; }

    bool publisherLoad();
    bool subscriberLoad();
    // Asks which resources of the tree have access lists of their own; nothing of the answer is kept. True when there
    // was one.
    bool publisherLoadResourceSet();
    bool saveSimpleACL();

    // What the two queries ask.
    static std::string currentUserPrivilegesBody();
    static std::string resourceSetBody();

    // What the answers say, without a server. Nothing when the answer is not one multistatus with a response.
    struct CurrentUserRights {
        bool mayWrite = false;
    };
    static std::optional<CurrentUserRights> rightsIn(const CXDAVNode& root);
    struct Resource {
        std::vector<Url> members;
        std::vector<CXACE> entries;
    };
    static std::optional<std::map<std::string, Resource>> resourcesIn(const CXDAVNode& root, const Url& base);

protected:
    const char* className() const override { return "CXDAVACLManager"; }
    void willChange(const Change& change) override;

private:
    std::optional<CXDAVNode> ask(const Url& target, std::string body);

    CXDAVManager& _manager;
    bool _loaded = false;
    std::vector<Change> _unsaved; // the owner's, in order, each once: the last time that it was asked for
};

} // namespace rolvane
