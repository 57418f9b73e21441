#pragma once

#include "model/CXDChangeRecord.h"

#include <compare>
#include <vector>

namespace rolvane {

struct GroupThatIsGone {
    UserName user;
    UniqueId group; // as the store names it
    auto operator<=>(const GroupThatIsGone&) const = default;
};

// What one side takes out of a publication while the other side changes it is out: a contact or group cannot be left
// half there, changed on the store and gone from the database or the other way round. The records of the other side
// about it are dropped. Whose change it is does not matter here: records from the store of one's own publication carry
// the owner's name, whoever wrote them.
//
// Gives the groups in which changes were made here, for nothing: somebody has to be told.
//
// To be called before mingling, without what the database swallows. Costs one walk when nothing is taken out, and in
// any case O(records).
std::vector<GroupThatIsGone> dropWhatTheOtherSideTookOut(CXDChangeRecords& records);

} // namespace rolvane
