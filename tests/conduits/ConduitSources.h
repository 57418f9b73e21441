#pragma once

#include "../store/StoreWorld.h"
#include "DaemonDatabase.h"
#include "FakeEngine.h"
#include "conduits/PublishedLayout.h"
#include "conduits/UserAlert.h"
#include "conduits/database/CXDCXConduit.h"
#include "conduits/local/CXDLocalConduit.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "model/PayloadKeys.h"
#include "store/account/CXNetworkController.h"
#include "support/TempHome.h"

#include <filesystem>
#include <functional>
#include <memory>
#include <set>
#include <string>

// The sources that the contract suite holds to one contract: each with a conduit, and a way to see what it holds that
// does not go through the conduit.
namespace rolvane::test {

// What a source does otherwise than the contract says, on purpose. A test of the contract that meets a deviation shows
// that it is real; nothing else excuses a source.
enum class Deviation {
    CallsTheOwnerByTheMarker,     // "<self>" has no other name there
    HasNoLocations,               // nobody's data lives at a URL there; so no location of it can be revoked
    TakesAnyName,                 // names are no names of files there
    RefusesTheTreesNamesForGood,  // a record that is called like the tree's own files does not wait for another time
    HasNoCompositeChange,         // the change is refused
    KeepsMembersAsKeys,           // a composite change has keys of its own, and the members stand as keys
    WritesContactsBesideTheirURL, // a contact is not where its location says
    KeepsDeletedContacts,         // a deletion fails, each time
    KeepsMemberMarkers,           // leaving a group leaves the mark of membership
    TakesOnlyTheNameOfANewGroup,  // what else its information says is dropped when it is made
    ForgetsOtherInfoOnRename,     // the name alone is left of a group's information
    KnowsNoSubgroups,             // neither subgroups nor chosen values: those changes are refused
};
std::ostream& operator<<(std::ostream& out, Deviation deviation);

class Source {
public:
    virtual ~Source() = default;
    virtual std::set<Deviation> deviations() const { return {}; }
    bool deviates(Deviation what) const { return deviations().contains(what); }

    virtual std::unique_ptr<CXDConduit> makeConduit() = 0;
    // One that names locations where they usually are, when that is elsewhere than in the tests. Touches nothing.
    virtual std::unique_ptr<CXDConduit> makeUsualConduit() { return makeConduit(); }

    virtual std::optional<Dictionary> contact(const std::string& uid) = 0;
    virtual std::optional<Dictionary> groupInfo(const std::string& uid) = 0;      // nothing: no such group
    virtual std::set<std::string> members(const std::string& group) = 0;          // one by one
    virtual std::set<std::string> compositeMembers(const std::string& group) = 0; // of the group's state
    virtual std::map<std::string, std::string> contents() = 0;                    // everything, for comparing

    FakeEngine engine;
    TempDirectory directory;
    ManualClock clock{Date(1'800'000'000)};
    NotificationCenter center;
    Preferences preferences{directory / "preferences.db", daemonMemory(directory / "contacts.db")};
    CXRolvane database{daemonDatabase(directory, clock, center)};
};

// Files below a directory, relative path to contents; what the server keeps for itself and the clock file are left out.
std::map<std::string, std::string> filesBelow(const std::string& directory);

struct SourceKind {
    const char* name;
    std::function<std::unique_ptr<Source>()> make;
};
const std::vector<SourceKind>& everySource();
void endSharedStore(); // the httpd that the network sources of a process share

} // namespace rolvane::test
