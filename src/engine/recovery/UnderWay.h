#pragma once

#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <unordered_set>

namespace rolvane {

class CXRolvane;

// What a pass is about to put on the network store of the owner's own: people, and groups with those members and
// subgroups that are put in or taken out, or whose name is set. Nothing but the end of the pass would remember it. It
// is put down before the workers begin; when the pass is killed and the person undoes such a change before the next
// one, no comparison of what is known with what is there finds anything, or one finds the pass's own write, takes it
// for somebody else's and brings it back.

// {"people": array, "groups": {group: {"memberAdds": array, "memberRemoves", "subgroupAdds", "subgroupRemoves":
// likewise, "named": true}}}; empty when there is nothing to remember.
Dictionary underWay(const CXDChangeRecords& records);
// Both together; neither is changed.
Dictionary underWayTogether(const Dictionary& former, const Dictionary& latter);

// What was under way when a pass was killed is made what the database says: whoever or whatever is gone is removed from
// the store, members are put in or taken out, names are set. The records for it are added to `records`, which is what
// the pass has gathered and the queue; and those are taken out by which the store would bring the same back. Of groups
// only those are spoken of that are shared still, which is to say that they are known or gathered.
void settleUnderWay(const Dictionary& underWay, CXDChangeRecords& records, Dictionary& conduitData, CXRolvane& rolvane);

// What is known at the end of a pass, identifiers in their shared form.
struct PassEnd {
    std::unordered_set<UniqueId> removed;      // people and groups that it took from the store, or has still to take
    std::unordered_set<UniqueId> unsureGroups; // whose changes wait, or may have been lost
    bool everythingIsPublished = false;        // and not single groups only
};
std::unordered_set<UniqueId> removedBy(const CXDChangeRecords& records);
bool isOwnWrite(const CXDChangeRecord& record); // of the owner's, to the network store
CXDChangeRecords ownWrites(const CXDChangeRecords& records);
std::unordered_set<UniqueId> groupsOf(const CXDChangeRecords& ownWrites);

// What of it the next pass is to look at again, because no comparison would: what the pass was to do to the groups of
// which that is not sure, and who or what is not in both lists of all that are known. Where a change of the list of all
// was lost or waits, a contact that is on the store already could leave the database without anybody's noticing. Where
// single groups are published, that list says little, and nothing is removed from the store one by one.
Dictionary adrift(const Dictionary& underWay, const Dictionary& conduitData, const PassEnd& end);

} // namespace rolvane
