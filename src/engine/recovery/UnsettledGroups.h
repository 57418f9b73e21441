#pragma once

#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <cstddef>

namespace rolvane {

// Identifier -> true. Records that waited in the queue come after the new ones, and of equal ones the first is kept:
// where a group's changes meet in one pass after a store was away, an older one may be applied last, or not at all. The
// groups (identifiers as the records name them) where that may be so, for the next scan to compare whatever their
// date. Every group whose change waited is among them: what was undone meanwhile left no record. `records`: the pass's
// input, `fresh` new ones and then the queue. Only changes that come from the contact database count. A person's
// changes that meet are a matter of the all-contacts group.
Dictionary unsettledGroups(const CXDChangeRecords& records, size_t fresh);

} // namespace rolvane
