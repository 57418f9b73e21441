#pragma once

#include "contacts/database/CXRolvane.h"

namespace rolvane {

// The steps in which the share count goes up in two files, each durable when it returns. A crash between any two is
// completed by `recover`; stopping in front of the first changes nothing. CXRolvane::bumpShareCount takes them all.
//   preferences: {"CXDShareCount": n, "CXDShareCountIntent": {"count": n, "identity": ..., "token": latest save}}
//   database:    share count n
//   preferences: the intent is taken away
class ShareCountBump {
public:
    ShareCountBump(CXRolvane& database, Preferences& preferences) : _database(database), _preferences(preferences) {}

    int64_t writeIntent(); // the new count
    void writeDatabase(int64_t count);
    void clearIntent();

    // Completes an interrupted bump when the database is the one that the intent was made for, or has gone on from
    // there: same identity, holds the save that the intent names, and has the count before. Then clears the intent.
    void recover();

private:
    CXRolvane& _database;
    Preferences& _preferences;
};

} // namespace rolvane
