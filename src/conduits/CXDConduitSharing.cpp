// The half of the conduit base that ends publications and subscriptions in the contact database.

#include "conduits/CXDConduit.h"
#include "contacts/CXRolvane.h"
#include "contacts/Constants.h"
#include "foundation/Preferences.h"

namespace rolvane {
namespace {

void removeMarksOfPublication(CXRolvane& database) {
    const CXAllGroupRef group = database.allGroup();
    for (const char* property : {kCXRemoteLocationProperty, kCXReadWriteSharingACLProperty, kCXReadSharingACLProperty})
        group->removeValueForProperty(property);
}

void removeCopies(CXRolvane& database, const RemoteLocation& location) {
    const CXAllGroupRef group = database.allGroupForRemoteLocation(location);
    if (!group) return;
    const CXSubscriptionRef subscription = group->subscription();
    for (const CXGroupRef& subgroup : group->subgroups()) database.removeRecord(subgroup);
    for (const CXPersonRef& member : group->members()) database.removeRecord(member);
    if (subscription) database.removeRecord(subscription);
}

} // namespace

CXRolvane& CXDConduit::database() const {
    return CXRolvane::sharedLocalRolvane();
}

Preferences& CXDConduit::preferences() const {
    return Preferences::shared();
}

void CXDConduit::cancelPublishing(const RemoteLocation& location) {
    removeMarksOfPublication(database());
    database().save();
    _engine.revokeRemoteLocation(location, std::nullopt);
}

void CXDConduit::cancelSharingTo(const RemoteLocation& location) {
    std::optional<UniqueId> subscription;
    if (_engine.userForRemoteLocation(location) != kSelf)
        if (const CXAllGroupRef group = database().allGroupForRemoteLocation(location))
            if (const CXSubscriptionRef found = group->subscription()) subscription = found->uniqueId();
    _engine.revokeRemoteLocation(location, subscription);
    removeRecordsAssociateWithRemoteLocation(location);
}

void CXDConduit::removeRecordsAssociateWithRemoteLocation(const RemoteLocation& location) {
    if (_engine.userForRemoteLocation(location) == kSelf)
        removeMarksOfPublication(database());
    else
        removeCopies(database(), location);
    database().save();
}

} // namespace rolvane
