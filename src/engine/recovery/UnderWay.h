#pragma once

#include "contacts/records/CXGroup.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <unordered_set>

namespace rolvane {

class CXRolvane;

// What a pass is about to put on the network store, by the user whose tree it is: people, and groups with those members
// and subgroups that are put in or taken out, and their new names. Nothing but the end of the pass would remember it.
// It is put down before the workers begin; when the pass is killed and the person undoes such a change before the next
// one, no comparison of what is known with what is there finds anything, or one finds the pass's own write, takes it
// for somebody else's and brings it back.

// {user: {"people": array, "subscription": text, "groups": {group: {"memberAdds": array, "memberRemoves",
// "subgroupAdds", "subgroupRemoves", "names": likewise}}}}; empty when there is nothing to remember.
Dictionary underWay(const CXDChangeRecords& records);
inline constexpr const char* kSubscription = "subscription"; // to the tree of somebody else; set by the caller
// Without those names, by group, which are not the pass's own.
Dictionary withoutNames(const Dictionary& underWay, const Dictionary& namesOfOthers);
// Where it names a group, also the names that an earlier note has for it: one of them may be on the store.
Dictionary withNamesBefore(const Dictionary& underWay, const Dictionary& former);
// A note of an earlier version knew the own tree alone, and had no user in it.
Dictionary underWayInAnyForm(const Dictionary& stored);
// Both together; neither is changed.
Dictionary underWayTogether(const Dictionary& former, const Dictionary& latter);

struct SharedTree {
    UserName user;
    CXGroupRef everybody; // the database's all-contacts group for it
    bool isRead = false;  // the records say all in which the tree differs from what is known
};
// What was under way in one tree when a pass was killed is made what the database says: whoever or whatever is gone is
// removed from the store, members are put in or taken out, names are set that the pass may have written. The records
// for it are added to `records`, which is what the pass has gathered, `fresh` of them, and the queue; and those are
// taken out by which the store would bring the same back. Of groups only those are spoken of that are shared still,
// which is to say that they are known or gathered. What the store and the database agree upon by now has arrived, and
// is folded into both prior states.
struct SettledUnderWay {
    Dictionary left;          // of it: what cannot be settled before the tree is read
    bool hasArrived = false;  // the prior states say so; a later pass cannot see it any more once somebody undoes it
    Dictionary namesOfOthers; // group to the name that somebody else gave it, which a record of the pass may repeat
};
SettledUnderWay settleUnderWay(const Dictionary& underWay, const SharedTree& tree, CXDChangeRecords& records,
                               size_t fresh, Dictionary& conduitData, CXRolvane& rolvane);

// What is known at the end of a pass, identifiers in their shared form.
struct PassEnd {
    std::unordered_set<UniqueId> removed;         // people and groups that it took from the store, or has still to take
    std::unordered_set<UniqueId> unsettledGroups; // whose changes wait, or may have been lost
    bool everythingIsPublished = false;           // and not single groups only
    Dictionary unread;                            // under way in trees that were not read, or whose changes wait
};
std::unordered_set<UniqueId> removedBy(const CXDChangeRecords& records);
bool isOwnWrite(const CXDChangeRecord& record); // of the owner's, to the network store
CXDChangeRecords ownWrites(const CXDChangeRecords& records);
std::unordered_set<UniqueId> groupsOf(const CXDChangeRecords& ownWrites);

// What of it the next pass is to look at again, because no comparison would: what the pass was to do to the groups of
// which that is not sure, and who or what is not in both lists of all that are known. Where a change of the list of all
// was lost or waits, a contact that is on the store already could leave the database without anybody's noticing. Where
// single groups are published, that list says little, and nothing is removed from the store one by one.
Dictionary unsettledAfter(const Dictionary& underWay, const Dictionary& conduitData, const PassEnd& end);

} // namespace rolvane
