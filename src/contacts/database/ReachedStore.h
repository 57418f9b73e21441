#pragma once

#include "foundation/Date.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <string>
#include <vector>

namespace rolvane {

// A new contact or group that a store has had, put there by a pass that may not have come to its end; or a name in
// lists of a store that has not taken the record's file yet.
struct CXReached {
    UniqueId uniqueId;   // as the database names the record
    UserName tree;       // whose it is, as change records name them
    Date since;          // by this machine's clock
    bool hasFile = true; // false: lists name it, and no file of it is known to have come
};

// The table of them. A pass that is killed forgets what it has done; these rows tell the next one that a record which
// is not on the store any more has been there, and was deleted by somebody. A name without a file that is gone from the
// lists was taken for a leftover, and nobody has deleted anything. The table is made when something is put there first.
// Not locked. The writing operations want an open transaction. Rows go with their record.
class ReachedStore {
public:
    explicit ReachedStore(Sqlite& database) : _database(database) {}

    std::vector<CXReached> all(); // in no order

    // Within a transaction ---------------------------------------------------------------------------------------
    // The record has to be stored. A later file replaces any note; a name without a file is only noted where there is
    // no note yet.
    void note(const CXReached& reached);
    void forget(const UniqueId& uid); // nothing happens where none is noted

private:
    bool hasTable();
    bool hasColumn(); // databases of earlier versions know of files alone
    Sqlite& _database;
};

} // namespace rolvane
