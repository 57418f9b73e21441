// The half of the conduit base that ends publications and subscriptions in the contact database.

#include "conduits/CXDConduit.h"
#include "conduits/WithdrawalNotice.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
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

WithdrawalNotice* CXDConduit::withdrawalNotice() const {
    return nullptr;
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
    const UserName user = _engine.userForRemoteLocation(location);
    if (user == kSelf) {
        removeMarksOfPublication(database());
        database().save();
        return;
    }
    // Without a subscription there is nothing that could leave, and nobody to be told.
    const bool subscribed = database().findSubscriptionWithRemoteLocation(location) != nullptr;
    WithdrawalNotice* notice = subscribed ? withdrawalNotice() : nullptr;
    const auto kept = notice ? notice->keep(database(), location, user) : std::nullopt;
    if (notice && !kept) return;
    removeCopies(database(), location);
    database().save();
    if (kept) notice->tell(*kept);
}

} // namespace rolvane
