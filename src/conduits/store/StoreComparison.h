#pragma once

#include "foundation/Date.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <functional>
#include <optional>
#include <string>

// Decides which change records carry the contact database from the state of a published store that was seen before to
// the one that is seen now. Pure but for the two questions of StoreUser; O(N), hashed.
//
//   state = user -> per-user state
//   per-user state = "SerialNumber" -> string,
//                    "People" -> {"memberUIDState" -> (person -> {"modificationdate" -> date})},
//                    <group, named "...CXGroup"> -> group state
//   group state = "memberUIDState" -> [person], "subgroupUIDState" -> [group], kCXGroupNameProperty -> string,
//                 "distributionListState" -> (person -> choices), and whatever else the group's file says
//
// States come from a store that anybody may have written to: what is of another kind than expected counts as absent.
namespace rolvane {

inline constexpr const char* kSerialNumber = "SerialNumber";
inline constexpr const char* kPeopleState = "People";
inline constexpr const char* kModificationDate = "modificationdate";
// Keys of a group difference, beside the member and subgroup keys of a composite change's payload.
inline constexpr const char* kNameChanges = "nameChanges";                         // array: no name or one
inline constexpr const char* kDistributionListUpdates = "distributionListUpdates"; // person -> new choices

// A file counts as changed when it is dated more than this many seconds after the last sync.
inline constexpr double kSyncMargin = 4.0;

// The user whose states are compared, and how the records say whose they are.
struct StoreUser {
    UserName user;
    RemoteLocation base; // the base location's absolute text
    int32_t source = 0;  // the conduit's bit: the records' initial source
    bool isNew = false;  // to this conduit: every contact is taken, whatever its date
    std::optional<Date> lastSyncDate;
    // Asked at most once, when a group is new: may the account's user write there?
    std::function<bool()> mayWrite;
    // The record that updates one contact: person in the right form, stamp, delayed payload, masks.
    std::function<CXDChangeRecordPtr(const UniqueId& contact)> contactUpdate;
};

// The records of one user, in order. Access lists and serial numbers are the caller's.
CXDChangeRecords compareStoreStates(const Dictionary& prior, const Dictionary& current, const StoreUser& user);

// {"memberAdds", "memberRemoves", "subgroupAdds", "subgroupRemoves", "nameChanges"} as arrays, and the two entries of
// the distribution-list difference. Either state may be absent. Additions are in the current order, removals in the
// prior one.
Dictionary groupDifference(const Value& prior, const Value& current);
// {"distributionListUpdates": dictionary, "distributionListRemoves": array}
Dictionary distributionListDifference(const Value& prior, const Value& current);

} // namespace rolvane
