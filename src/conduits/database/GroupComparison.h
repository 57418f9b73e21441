#pragma once

#include "foundation/StrongString.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <optional>
#include <variant>
#include <vector>

// Decides which change records carry a group of the contact database from the state that its remote location is known
// to hold to the state that it has now. Pure: no database, no engine.
//
// A group state is a dictionary of "memberUIDState" and "subgroupUIDState" (arrays of identifiers), the name, the two
// access lists (arrays of principals) and "distributionListState" (person -> property -> chosen value's identifier).
namespace rolvane {

// Whom the records of a comparison are for.
struct GroupAddress {
    UniqueId guid;       // table "CXGroup"
    UserName user;       // whose data lives at the remote location
    int32_t sources = 0; // the applies-to mask
    // The all-contacts group that a new group is put into. Only looked at when the group is new; none when the location
    // has no all-contacts group, and then the new group is still announced as somebody's subgroup.
    std::optional<UniqueId> allGroup;
};

// Where the caller puts all records of that member's data, so that the data travels before the membership.
struct CaptureMember {
    UniqueId person;
};
// Where the caller puts all records of that subgroup's own comparison.
struct CaptureSubgroup {
    UniqueId group;
};
using GroupStep = std::variant<CXDChangeRecordPtr, CaptureMember, CaptureSubgroup>;
using GroupSteps = std::vector<GroupStep>;

// The steps in the order in which their records go out. Each of the two states is a dictionary or absent.
GroupSteps compareGroupStates(const Value& prior, const Value& current, const GroupAddress& address);

// One record for every person of `current` whose choices differ from `prior`'s or are not in it. A person that is only
// in `prior` has left the group, and the record of that removal says so.
CXDChangeRecords compareDistributionStates(const Dictionary& prior, const Dictionary& current,
                                           const GroupAddress& address);

} // namespace rolvane
