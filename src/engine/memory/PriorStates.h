#pragma once

#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <cstdint>

namespace rolvane {

// What every source holds, as last known: conduit identifier, "priorState", user, group, state. Pure functions over the
// conduit data. Identifiers are normalised on writing ("CXGroup", "CXPerson"); a record folds in O(1) expected, in the
// number of its own members, but for taking members out, which walks the group's list.

// Folds an applied record into the state of one source. Does nothing for sources without a conduit and for records that
// lack what their type needs.
void updateCache(Dictionary& conduitData, int32_t source, const CXDChangeRecord& record);
// didApplyChange:toSource:. For the source, and for the source that the record came from when it is another.
void didApplyChange(Dictionary& conduitData, const CXDChangeRecord& record, int32_t source);

int32_t sourcesForGUID(const Dictionary& conduitData, const UniqueId& group); // bits 4 and 2; 0 when nobody has it
bool isGUIDPublished(const Dictionary& conduitData, const UniqueId& group);   // by the owner, anywhere
void removeGUID(Dictionary& conduitData, const UniqueId& group);              // from every user of every conduit

} // namespace rolvane
