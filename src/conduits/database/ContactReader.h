#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace rolvane {

// What change capture reads of the contact database, as values and with few queries: what was read of a group is kept
// for the reader's life, which is one gathering. An edit that another process saves meanwhile may or may not be seen;
// the journal tells of it afterwards. Main thread only.
class ContactReader {
public:
    explicit ContactReader(CXRolvane& rolvane) : _rolvane(rolvane) {}
    ContactReader(const ContactReader&) = delete;
    ContactReader& operator=(const ContactReader&) = delete;

    CXRolvane& rolvane() const { return _rolvane; }

    // A normalised identifier finds the subscribed copy of a record before the plain one; null when there is neither.
    CXRecordRef recordForUniqueId(const UniqueId& uid) const;
    // The row of the person that recordForUniqueId finds, read without making an object.
    std::optional<CXRow> personForUniqueId(const UniqueId& uid) const;
    // One query, after which the next operation always knows.
    void learnSubscribedPeople() { subscribedPeople(); }
    // The `uniqueId` of that person, where it is known without asking the database; the person may be gone.
    std::optional<UniqueId> knownPersonFor(const UniqueId& uid) const;
    // The same for many members of one group in a few queries: calls for each member of the group that is in `wanted`
    // and is itself what its shared identifier finds. The others are left to personForUniqueId.
    void forEachMember(const CXGroup& group, const std::unordered_set<UniqueId>& wanted,
                       const std::function<void(const CXRow&)>& call);

    // Where a person's data is shared: locations published or subscribed to by the groups that list the person and by
    // the all-contacts group of the person's database, each once, in the order in which they are met.
    std::vector<RemoteLocation> locationsOfPerson(const CXRow& person);
    // The location under which a group is compared: its own first one, else the first one of the database's
    // all-contacts group; none when neither is shared. An empty multi-value is no location: it marks a database of
    // which only single groups are published.
    std::optional<RemoteLocation> locationOfGroup(const CXGroup& group) const;

    // The same identifier, perhaps with a text that is there already.
    using TextSharing = std::function<UniqueId(const UniqueId&)>;
    // The group as it stands now: members, subgroups, name, access lists and, when asked for, distribution choices.
    // Members who are among the `known` ones share their texts.
    Dictionary groupState(const CXGroup& group, bool withDistributionLists, const Array& known = {},
                          const TextSharing& share = {}) const;
    static Dictionary distributionListState(const CXGroup& group);
    // The person's choices in one of the groups that list the person. With `many` expected, a group's choices are read
    // at once and kept; otherwise those of one person.
    Dictionary choices(const CXRow& person, const UniqueId& group);
    void expectMany() { _many = true; }

private:
    const std::vector<RemoteLocation>& sharedLocations(const UniqueId& group);
    const std::vector<RemoteLocation>& sharedLocationsOfAllGroup(const RemoteLocation& location);
    const std::map<UniqueId, CXDistributionChoices>& choicesOfPerson(const UniqueId& person);
    const std::unordered_set<std::string>& subscribedPeople();

    CXRolvane& _rolvane;
    bool _many = false;
    std::unordered_map<UniqueId, std::vector<RemoteLocation>> _sharedLocations;         // by group
    std::unordered_map<RemoteLocation, std::vector<RemoteLocation>> _allGroupLocations; // by the all group's location
    std::unordered_map<UniqueId, std::map<UniqueId, CXDistributionChoices>> _groupChoices; // by group, then person
    std::optional<UniqueId> _person;                                  // whose choices _personChoices holds
    std::map<UniqueId, CXDistributionChoices> _personChoices;         // by group
    std::optional<std::unordered_set<std::string>> _subscribedPeople; // the UUIDs of subscribed people
};

} // namespace rolvane
