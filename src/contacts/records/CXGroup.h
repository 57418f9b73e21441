#pragma once

#include "contacts/records/CXPerson.h"

#include <map>
#include <utility>

namespace rolvane {

class CXSubscription;
using CXSubscriptionRef = std::shared_ptr<CXSubscription>;

// A person's chosen values in one group: property name -> identifier of a value.
using CXDistributionChoices = std::map<std::string, std::string>;

// A group. Always has a non-empty name: one is given at creation, and it can be changed but not taken away.
// Members and subgroups keep the order in which they were added. A person or group is listed at most once.
class CXGroup : public CXRecord {
public:
    static CXGroupRef create();                              // fresh identifier, in no database yet
    static CXGroupRef initWithUniqueId(const UniqueId& uid); // CXSubscribedGroup by table
    static CXSearchElement searchElementForProperty(std::string_view property, std::string_view label,
                                                    std::string_view key, Value value, int comparison);

    std::string name() const;

    // As objects; for the all-contacts groups everything of their location. Prefer the sets below for large groups.
    std::vector<CXPersonRef> members() const;
    std::vector<CXGroupRef> subgroups() const;
    // In member order, one query, no objects: `sharingUniqueId`s, and `uniqueId`s.
    std::vector<UniqueId> memberIdentifiers() const { return memberIdentifiersLike({}); }
    // The same; those that are also in `known`, in the same order but for changes, share the text of the string there.
    virtual std::vector<UniqueId> memberIdentifiersLike(const Array& known) const;
    std::vector<UniqueId> subgroupIdentifiers() const;
    virtual std::vector<UniqueId> memberUniqueIds() const;
    virtual std::vector<UniqueId> subgroupUniqueIds() const;
    virtual size_t memberCount() const;

    // The four changes throw kCXInvalidArgumentException when this group or the other record is in no database or in
    // another one. Listing what is listed and unlisting what is not are no changes; both give false.
    // On an all-contacts group they do nothing and give false: membership there is a matter of location.
    virtual bool addMember(const CXPersonRef& person);
    virtual bool removeMember(const CXPersonRef& person); // takes the person's distribution choices along
    // Throws kCXInvalidArgumentException, naming both groups, when it would make the group contain itself.
    virtual bool addSubgroup(const CXGroupRef& group);
    // Would addSubgroup not throw? False for an all-contacts group and for what this group is, or is below of.
    bool mayListSubgroup(const CXGroupRef& group) const;
    virtual bool removeSubgroup(const CXGroupRef& group);
    std::vector<CXGroupRef> parentGroups() const; // the groups that list this one

    // Which value of the person's multi-value property this group uses; nothing when it holds no choice.
    std::optional<std::string> distributionIdentifierForProperty(std::string_view property,
                                                                 const CXPersonRef& person) const;
    // Nothing clears the choice. The person need not be a member (yet). All-contacts groups hold no choices.
    void setDistributionIdentifier(const std::optional<std::string>& identifier, std::string_view property,
                                   const CXPersonRef& person);
    // Of the whole group in one query: the person's `uniqueId` -> choices. Only choices for properties that the person
    // uses; people without any are not in it. Members only.
    std::map<UniqueId, CXDistributionChoices> distributionChoices() const;
    // The choices of all groups for one person, one query: the group's `uniqueId` -> choices.
    static std::map<UniqueId, CXDistributionChoices> distributionChoicesForPerson(const CXPerson& person);

    // Of a subscribed group: the subscription that it came by, null when that is gone. Null for the owner's own.
    CXSubscriptionRef subscription() const;
    virtual bool isAllGroup() const { return false; }

protected:
    using CXRecord::CXRecord;
    friend class CXRolvane;
};

// A copy of somebody else's group that came by a subscription.
class CXSubscribedGroup : public CXGroup {
public:
    static CXGroupRef initWithUniqueId(const UniqueId& uid);
    static CXSearchElement searchElementForProperty(std::string_view property, std::string_view label,
                                                    std::string_view key, Value value, int comparison);

protected:
    using CXGroup::CXGroup;
    friend class CXGroup;
    friend class CXRolvane;
};

// What a journal entry "members, subgroups or distribution choices of a group changed" names: an identifier
// "<UUID of the group>:CXGroupContents" (or "...:CXSubscribedGroupContents"). Found as long as the group exists.
class CXGroupContents : public CXRecord {
public:
    UniqueId nts_GroupUID() const; // the group's uniqueId

protected:
    using CXRecord::CXRecord;
    friend class CXRolvane;
};

// What a journal entry "a property of this database's all-contacts group changed" names: "<identity>:CXInfo".
class CXInfo : public CXRecord {
protected:
    using CXRecord::CXRecord;
    friend class CXRolvane;
};

} // namespace rolvane
