#pragma once

#include "contacts/database/CXRolvane.h"
#include "server/mod_cardbook/BookMemory.h"

namespace rolvane::cardbook {

// Takes in what any program has saved since the memory's position in the database's journal: which cards came, changed
// or left, book by book. Where the journal does not reach back so far everything is compared, and tokens go on being
// exact; so it is with another database, and with an earlier copy of this one.
void catchUp(CXRolvane& rolvane, BookMemory& memory);

} // namespace rolvane::cardbook
