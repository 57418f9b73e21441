#pragma once

#include "contacts/records/ContactMerge.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <optional>
#include <vector>

namespace rolvane {

// One value of a contact that gave way to another one, since two people had changed it at once.
struct CXConflict {
    int64_t number = 0; // given by the log
    UniqueId uniqueId;
    std::string name; // of the contact, as it was shown then
    Date date;        // when it was found out
    CXMergeConflict merge;
};

// The table of them. Not locked. The writing operations want an open transaction.
class ConflictLog {
public:
    explicit ConflictLog(Sqlite& database) : _database(database) {}

    static constexpr size_t kKept = 500; // the oldest are forgotten
    static constexpr const char* kTable = R"(
CREATE TABLE IF NOT EXISTS conflicts(
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  uid TEXT NOT NULL,
  name TEXT NOT NULL,
  date REAL NOT NULL,
  property TEXT NOT NULL,
  kept BLOB NOT NULL,
  lost BLOB NOT NULL,
  winner INTEGER NOT NULL);
)";

    std::vector<CXConflict> all(); // oldest first
    std::optional<CXConflict> find(int64_t number);

    // Within a transaction ---------------------------------------------------------------------------------------
    void note(const CXConflict& conflict); // what stands there with the same values is not noted again
    bool forget(int64_t number);           // false when there is none

private:
    std::vector<CXConflict> selected(std::string_view condition, int64_t number);
    Sqlite& _database;
};

} // namespace rolvane
