#pragma once

#include "foundation/Preferences.h"

#include <memory>
#include <string>

namespace rolvane {

class Sqlite;

// The daemon's memory of one contact database, a table: the queue, the states of the sources, and the dates of the last
// looks at them. It lies in the database's own file, so that a pass ends in one transaction and a copy
// of the file has the memory that fits it. A person's settings, and notes that concern the account, stay in the
// preferences. Not locked. The writing operation wants an open transaction.
class MemoryTable {
public:
    explicit MemoryTable(Sqlite& database) : _database(database) {}

    // The keys have an index of their own: SQLite reads whatever lies beside the keys that it passes on its way to one,
    // and a state of many people takes megabytes.
    static constexpr const char* kTable = R"(
CREATE TABLE IF NOT EXISTS daemon(key TEXT NOT NULL PRIMARY KEY, value BLOB NOT NULL);
)";

    static bool hasKey(std::string_view key); // is the key of the daemon's domain one of the table's?
    std::optional<Bytes> value(std::string_view key);
    std::vector<std::string> keys(); // in byte order
    void write(const PreferencesChanges& changes);

private:
    Sqlite& _database;
};

// The table behind the preferences, by a connection of its own. The path is the database's; "": that of
// dataDirectory(). The file is opened with the first use and never made: without it there is nothing to read, and
// writing throws kCXDatabaseException, as does everything once the file was moved away.
std::shared_ptr<PreferencesKeeper> daemonMemory(std::string path = {});

} // namespace rolvane
