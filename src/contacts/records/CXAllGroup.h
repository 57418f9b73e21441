#pragma once

#include "contacts/records/CXGroup.h"

namespace rolvane {

class CXAllGroup;
using CXAllGroupRef = std::shared_ptr<CXAllGroup>;

// An all-contacts group: of this database ("AllCXGroup"; people and groups of the owner's own), or of a subscribed
// location (people and groups that came from there; made and removed with the subscription). Its members and subgroups
// are queries by location, oldest record first, never lists. Named "All Contacts" (localized) until somebody renames
// it.
class CXAllGroup : public CXGroup {
public:
    // Of the process's shared database.
    static CXAllGroupRef allGroup();
    // Null when the shared database has no subscription to the location; the database's own for "local".
    static CXAllGroupRef allGroupForRemoteLocation(const RemoteLocation& location);

    std::vector<UniqueId> memberIdentifiersLike(const Array& known) const override;
    std::vector<UniqueId> memberUniqueIds() const override;
    std::vector<UniqueId> subgroupUniqueIds() const override;
    size_t memberCount() const override;
    bool addMember(const CXPersonRef& person) override;
    bool removeMember(const CXPersonRef& person) override;
    bool addSubgroup(const CXGroupRef& group) override;
    bool removeSubgroup(const CXGroupRef& group) override;
    UniqueId sharingUniqueId() const override; // always "AllCXGroup"
    bool isAllGroup() const override { return true; }

protected:
    using CXGroup::CXGroup;
    friend class CXRolvane;
};

} // namespace rolvane
