#pragma once

#include "foundation/StrongString.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <string>
#include <unordered_map>
#include <vector>

namespace rolvane {

// Decides which records withdraw a deleted person or group: what is deleted is in no current state any more, so every
// place that is known to have held it is searched. Pure, over a prior state (user -> group -> state), which must not
// change meanwhile. All records go to the network store, wherever the group is published.
class RemovalChanges {
public:
    // With many deletions to come the prior state is walked once for all of them, otherwise once for each.
    explicit RemovalChanges(Dictionary priorState, size_t expectedDeletions = 1);

    // `person` ends in "CXPerson". Every mention counts, a person that a group lists twice included.
    CXDChangeRecords changesToRemovePerson(const UniqueId& person) const;
    // `group` ends in "CXGroup".
    CXDChangeRecords changesToRemoveGroup(const UniqueId& group) const;

private:
    // A group of a user, and how often its list names what was asked for.
    struct Mention {
        std::string user, group;
        size_t times;
    };
    using Mentions = std::vector<Mention>;
    using Index = std::unordered_map<std::string, Mentions>;

    Mentions mentions(const char* list, const Index& index, const UniqueId& uid) const;
    Index indexOf(const char* list) const;

    Dictionary _priorState;
    bool _indexed;
    Index _members, _subgroups;
};

} // namespace rolvane
