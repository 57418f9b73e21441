#pragma once

#include "model/CXDChangeRecord.h"

#include <cstddef>

namespace rolvane {

class CXRolvane;

// What waited for a store may put there somebody, or a group, that has left the database meanwhile; nothing that is
// known of the store would ever take it away again. Each such change of the owner's own becomes the removal of what it
// is about, and whoever was to be put into a group is taken out of it and removed. `records`: the pass's input, `fresh`
// new ones and then the queue, which alone is looked at.
void withdrawWhatIsGone(CXDChangeRecords& records, size_t fresh, CXRolvane& rolvane);

} // namespace rolvane
