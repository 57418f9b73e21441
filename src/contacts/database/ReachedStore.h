#pragma once

#include "foundation/Date.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <string>
#include <vector>

namespace rolvane {

// A new contact or group that a store has had, put there by a pass that may not have come to its end.
struct CXReached {
    UniqueId uniqueId; // as the database names the record
    UserName tree;     // whose it is, as change records name them
    Date since;        // by this machine's clock
};

// The table of them. A pass that is killed forgets what it has done; these rows tell the next one that a record which
// is not on the store any more has been there, and was deleted by somebody. The table is made when something is put
// there first. Not locked. The writing operations want an open transaction. Rows go with their record.
class ReachedStore {
public:
    explicit ReachedStore(Sqlite& database) : _database(database) {}

    std::vector<CXReached> all(); // in no order

    // Within a transaction ---------------------------------------------------------------------------------------
    void note(const CXReached& reached); // of records that are stored; a later date takes the place of an earlier one
    void forget(const UniqueId& uid);    // nothing happens where none is noted

private:
    bool hasTable();
    Sqlite& _database;
};

} // namespace rolvane
