#include "contacts/database/ReachedStore.h"

namespace rolvane {

namespace {

constexpr const char* kTable = R"(
CREATE TABLE IF NOT EXISTS reached(
  record_id INTEGER PRIMARY KEY REFERENCES records(id) ON DELETE CASCADE,
  tree TEXT NOT NULL,
  since REAL NOT NULL,
  has_file INTEGER NOT NULL DEFAULT 1);
)";

} // namespace

bool ReachedStore::hasTable() {
    return _database.statement("SELECT 1 FROM sqlite_master WHERE type='table' AND name='reached'").step();
}

bool ReachedStore::hasColumn() {
    return _database.statement("SELECT 1 FROM pragma_table_info('reached') WHERE name='has_file'").step();
}

std::vector<CXReached> ReachedStore::all() {
    std::vector<CXReached> all;
    if (!hasTable()) return all;
    const std::string hasFile = hasColumn() ? "t.has_file" : "1";
    auto s = _database.statement("SELECT r.uid, t.tree, t.since, " + hasFile +
                                 " FROM reached t JOIN records r ON r.id=t.record_id");
    while (s.step())
        all.push_back(
            {UniqueId(s.textView(0)), UserName(std::string(s.textView(1))), Date(s.real(2)), s.integer(3) != 0});
    return all;
}

void ReachedStore::note(const CXReached& reached) {
    if (!hasTable())
        _database.execute(kTable);
    else if (!hasColumn())
        _database.execute("ALTER TABLE reached ADD COLUMN has_file INTEGER NOT NULL DEFAULT 1");
    auto s = _database.statement(std::string("INSERT OR ") + (reached.hasFile ? "REPLACE" : "IGNORE") +
                                 " INTO reached(record_id, tree, since, has_file)"
                                 " SELECT id, ?2, ?3, ?4 FROM records WHERE uid=?1");
    s.bind(1, reached.uniqueId.str()).bind(2, reached.tree.str()).bind(3, reached.since.secondsSince1970());
    s.bind(4, int64_t{reached.hasFile}).run();
}

void ReachedStore::forget(const UniqueId& uid) {
    if (!hasTable()) return;
    _database.statement("DELETE FROM reached WHERE record_id=(SELECT id FROM records WHERE uid=?)")
        .bind(1, uid.str())
        .run();
}

} // namespace rolvane
