#pragma once

#include "foundation/StrongString.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <functional>
#include <optional>

namespace rolvane {

class CXRolvane;

// What other sources' changes are about to do to groups in the contact database. A pass that saves the database on its
// way puts this down first: when the process dies before the pass has come to its end, the next one can tell what had
// arrived until then from what the person did, whichever of the later saves was the last.

// An array of dictionaries, one for each type of change, source, user and group, of the records at `from` and behind it
// that are still to be applied to the contact database.
Array arrivalsAmong(const CXDChangeRecords& records, size_t from);

// Folds those arrivals that the database shows to be there, and none of the others, into the prior states of the
// database and of where they came from: had the one forgotten them, they would be the person's own additions; had the
// other, their removal there would never be noticed. `locationOf` tells where the user's subscription comes from;
// nothing when there is none.
using LocationOfUser = std::function<std::optional<RemoteLocation>(const UserName&)>;
void foldArrivals(Dictionary& conduitData, const Array& arrivals, CXRolvane& rolvane, const LocationOfUser& locationOf);

} // namespace rolvane
