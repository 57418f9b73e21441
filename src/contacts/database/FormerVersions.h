#pragma once

#include "foundation/Date.h"
#include "foundation/Sqlite.h"
#include "foundation/StrongString.h"

#include <memory>

namespace rolvane {

// People's and groups' properties before their latest edits, for programs that are told of an edit without being told
// what it was made of. Kept from when somebody asks for it, by every program that saves. Not locked. The writing
// operations want an open transaction.
class FormerVersions {
public:
    explicit FormerVersions(Sqlite& database) : _database(database) {}

    static constexpr int kKept = 1000; // the oldest are forgotten
    static constexpr const char* kTable = R"(
CREATE TABLE IF NOT EXISTS former(
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  uid TEXT NOT NULL,
  modified REAL NOT NULL,
  replaced REAL NOT NULL,
  properties BLOB NOT NULL);
CREATE INDEX IF NOT EXISTS former_uid ON former(uid, replaced);
)";

    void begin(); // makes the table, and is durable on return
    bool areKept();
    // The encoded properties that the record had at that time, null when they are the present ones or not known. The
    // date of a version names it whatever the clock did.
    std::shared_ptr<const Bytes> of(const UniqueId& uid, Date at);

    void keep(const UniqueId& uid, Date modified, Date replaced, const Bytes& properties);
    void prune();

private:
    Sqlite& _database;
};

} // namespace rolvane
