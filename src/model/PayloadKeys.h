#pragma once

namespace rolvane {

// Keys of a composite group change's payload. The group's new name stands under kCXGroupNameProperty beside them.
inline constexpr const char* kMemberAdds = "memberAdds";                           // array of identifiers
inline constexpr const char* kMemberRemoves = "memberRemoves";                     // array of identifiers
inline constexpr const char* kSubgroupAdds = "subgroupAdds";                       // array of identifiers
inline constexpr const char* kSubgroupRemoves = "subgroupRemoves";                 // array of identifiers
inline constexpr const char* kDistributionListAdds = "distributionListAdds";       // identifier to list value
inline constexpr const char* kDistributionListRemoves = "distributionListRemoves"; // array of identifiers

// Keys of an access-list change's payload: arrays of principals.
inline constexpr const char* kAdditions = "additions";
inline constexpr const char* kDeletions = "deletions";

// Keys of a group's state inside a prior or current state. Its name and access lists stand under the property names.
inline constexpr const char* kMemberUIDState = "memberUIDState";               // array of person identifiers
inline constexpr const char* kSubgroupUIDState = "subgroupUIDState";           // array of group identifiers
inline constexpr const char* kDistributionListState = "distributionListState"; // person identifier to list value

// Where a conduit's prior state stands in its data: user to group identifier to group state.
inline constexpr const char* kPriorState = "priorState";
// Beside it, for the contact database: identifier -> true, groups that the next scan compares whatever their date, or
// withdraws when they are gone.
inline constexpr const char* kUnsettledGroups = "unsettledGroups";
// identifier -> true, the owner's people whose contact the store has refused: the next scan sends them whatever their
// date, or has them removed from the store when they are gone.
inline constexpr const char* kUnsettledPeople = "unsettledPeople";
// How long what the owner's store has refused rests: see engine/queue/RefusedChanges.h.
inline constexpr const char* kRefusedByStore = "refusedByStore";
// And: owner marker -> false when the owner's published tree has lost what it held, so that the next scan takes
// everything for new; true from that scan on until all of it is written.
inline constexpr const char* kPublishAgain = "publishAgain";
// In that: true where the tree was set back to an older copy, so that nothing in it is anybody's news.
inline constexpr const char* kOlderCopy = "olderCopy";

} // namespace rolvane
