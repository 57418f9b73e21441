#pragma once

#include "acl/CXACLManager.h"

#include <memory>

namespace rolvane {

class CXAllGroup;
class CXRolvane;

// What the current user may do with a location that somebody else published, as the contact database remembers it: two
// sharing properties of the all-contacts group that the database keeps for the location. Each is a multi-value with one
// entry whose value and label are the current user's real name; kCXReadSharingACLProperty is there when the user may
// read, kCXReadWriteSharingACLProperty when the user may write as well. One thread at a time.
class CXDCXACLManager final : public CXACLManager {
public:
    // Loads. The database is borrowed and outlives the manager; `realUser` is how it names the current user.
    CXDCXACLManager(Url baseLocation, const LocationOwner& owner, CXRolvane& database, UserName realUser);

    // "<self>" may read, whatever the properties say, and may write when kCXReadWriteSharingACLProperty has entries.
    // Adds to the lists and takes nothing away. True always.
    bool load() override;
    // Sets or removes the two properties by the two lists; a property that says so already stays as it is. The database
    // is not saved. Nothing happens for the user's own publication, nor for a location that the database has no
    // all-contacts group for. True always.
    bool save() override;

protected:
    const char* className() const override { return "CXDCXACLManager"; }

private:
    std::shared_ptr<CXAllGroup> allGroup() const; // null when the location is not subscribed

    CXRolvane& _database;
    const UserName _realUser;
};

} // namespace rolvane
