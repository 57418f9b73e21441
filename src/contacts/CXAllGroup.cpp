#include "contacts/CXAllGroup.h"

#include "contacts/RolvaneImpl.h"

namespace rolvane {

namespace {

// People (or groups) of the location that the all-contacts group stands for.
std::vector<UniqueId> everything(const CXAllGroup& group, RecordKind own, RecordKind subscribed) {
    CXRolvane* database = group.rolvane();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    if (!group.isAttached()) return {};
    if (!group.isSubscribed()) return database->impl().recordsOf(own, std::nullopt);
    return database->impl().recordsOf(subscribed, group.remoteLocation().str());
}

} // namespace

CXAllGroupRef CXAllGroup::allGroup() {
    return CXRolvane::sharedRolvane().allGroup();
}

CXAllGroupRef CXAllGroup::allGroupForRemoteLocation(const RemoteLocation& location) {
    return CXRolvane::sharedRolvane().allGroupForRemoteLocation(location);
}

UniqueId CXAllGroup::sharingUniqueId() const {
    return UniqueId(kCXAllGroupUID);
}

std::vector<UniqueId> CXAllGroup::memberUniqueIds() const {
    return everything(*this, RecordKind::person, RecordKind::subscribedPerson);
}

std::vector<UniqueId> CXAllGroup::subgroupUniqueIds() const {
    return everything(*this, RecordKind::group, RecordKind::subscribedGroup);
}

size_t CXAllGroup::memberCount() const {
    return memberUniqueIds().size();
}

bool CXAllGroup::addMember(const CXPersonRef&) {
    return false;
}
bool CXAllGroup::removeMember(const CXPersonRef&) {
    return false;
}
bool CXAllGroup::addSubgroup(const CXGroupRef&) {
    return false;
}
bool CXAllGroup::removeSubgroup(const CXGroupRef&) {
    return false;
}

} // namespace rolvane
