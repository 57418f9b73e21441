#pragma once

#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <functional>

namespace rolvane {

class CXRolvane;

// What waited for a store may put there somebody, or a group, that has left the database meanwhile; nothing that is
// known of the store would ever take it away again. Each such change becomes the removal of what it is about, and
// whoever was to be put into a group is taken out of it and removed. `records`: the pass's input, `fresh` new ones and
// then the queue, which alone is looked at, and of it the changes in trees whose copies are here.
void withdrawWhatIsGone(CXDChangeRecords& records, size_t fresh, CXRolvane& rolvane,
                        const std::function<bool(const UserName& user)>& hasCopies);

// And the other way round: what was to be removed from the store may be in the database again, an undone deletion or an
// imported card. The waiting removal is behind the changes that bring it back, and would be taken for the later one.
void dropRemovalsOfWhatIsBack(CXDChangeRecords& records, size_t fresh, CXRolvane& rolvane);

} // namespace rolvane
