#include "contacts/records/CXAllGroup.h"

#include "contacts/database/RolvaneImpl.h"

namespace rolvane {

namespace {

// Calls with where people (or groups) of the location that the all-contacts group stands for are found: the database,
// their kind and their location. Gives nothing when the group is in no database.
template <class Call>
auto everything(const CXAllGroup& group, RecordKind own, RecordKind subscribed, Call&& call)
    -> decltype(call(std::declval<CXRolvane::Impl&>(), own, std::optional<std::string>())) {
    CXRolvane* database = group.rolvane();
    if (!database) return {};
    std::lock_guard lock(database->impl().mutex);
    if (!group.isAttached()) return {};
    if (!group.isSubscribed()) return call(database->impl(), own, std::optional<std::string>());
    return call(database->impl(), subscribed, std::optional(group.remoteLocation().str()));
}

template <class Call>
auto everybody(const CXAllGroup& group, Call&& call) {
    return everything(group, RecordKind::person, RecordKind::subscribedPerson, std::forward<Call>(call));
}

std::vector<UniqueId> recordsOf(CXRolvane::Impl& database, RecordKind kind,
                                const std::optional<std::string>& location) {
    return database.recordsOf(kind, location);
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

std::vector<UniqueId> CXAllGroup::memberIdentifiersLike(const Array& known) const {
    SharedForms forms(known);
    return everybody(*this, [&](CXRolvane::Impl& database, RecordKind kind, const auto& location) {
        return database.sharedFormsOf(kind, location, forms);
    });
}

std::vector<UniqueId> CXAllGroup::memberUniqueIds() const {
    return everybody(*this, recordsOf);
}

std::vector<UniqueId> CXAllGroup::subgroupUniqueIds() const {
    return everything(*this, RecordKind::group, RecordKind::subscribedGroup, recordsOf);
}

size_t CXAllGroup::memberCount() const {
    return everybody(*this, [](CXRolvane::Impl& database, RecordKind kind, const auto& location) {
        return database.countOf(kind, location);
    });
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
