#pragma once

#include "foundation/Value.h"

#include <map>
#include <string>

namespace rolvane {

// The conduit data in the rows that it is stored in: one a group that a conduit knows, under
// "CXDConduitData/<conduit>/<user>/<group>" with the parts percent-encoded, and under "CXDConduitData" all the rest. So
// a pass writes the groups that it changed, and not all. Earlier versions stored one row; joined it gives the same.
using StateRows = std::map<std::string, Value>;
StateRows stateRows(const Dictionary& conduitData); // the groups' values are those of the conduit data, not copies
// New containers.
Dictionary joinedRows(const StateRows& rows);
bool isStateRow(std::string_view key);

} // namespace rolvane
