#include "contacts/database/RecordStore.h"

#include "contacts/database/ChangeLog.h"
#include "contacts/database/CommonVersions.h"
#include "contacts/database/ConflictLog.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/database/DatabaseErrors.h"
#include "foundation/Paths.h"
#include "foundation/PropertyList.h"
#include "foundation/TestSwitch.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <map>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int kFormat = 9;
constexpr int64_t kApplicationId = 0x52564c43; // "RVLC"

constexpr const char* kTables = R"(
CREATE TABLE meta(key TEXT PRIMARY KEY, value) WITHOUT ROWID;
CREATE TABLE records(
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  uid TEXT NOT NULL UNIQUE,
  kind INTEGER NOT NULL,
  location TEXT NOT NULL,
  created REAL NOT NULL,
  modified REAL NOT NULL,
  display TEXT NOT NULL,
  sort TEXT NOT NULL,
  search TEXT NOT NULL,
  properties BLOB NOT NULL,
  writer TEXT NOT NULL DEFAULT '');
CREATE INDEX records_modified ON records(kind, modified);
CREATE INDEX records_location ON records(kind, location, id, uid);
CREATE INDEX records_names ON records(id, uid, kind);
CREATE INDEX records_display ON records(display COLLATE NOCASE, kind, uid, location, sort);
CREATE INDEX records_search ON records(id, kind, search);
CREATE TABLE listed(
  group_id INTEGER NOT NULL REFERENCES records(id) ON DELETE CASCADE,
  position INTEGER NOT NULL,
  member_id INTEGER NOT NULL REFERENCES records(id) ON DELETE CASCADE,
  PRIMARY KEY(group_id, position)) WITHOUT ROWID;
CREATE UNIQUE INDEX listed_member ON listed(member_id, group_id);
CREATE TABLE choices(
  group_id INTEGER NOT NULL REFERENCES records(id) ON DELETE CASCADE,
  person_id INTEGER NOT NULL REFERENCES records(id) ON DELETE CASCADE,
  property TEXT NOT NULL,
  identifier TEXT NOT NULL,
  PRIMARY KEY(group_id, person_id, property)) WITHOUT ROWID;
CREATE INDEX choices_person ON choices(person_id);
CREATE TABLE saves(
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  pid INTEGER NOT NULL,
  program TEXT NOT NULL,
  date REAL NOT NULL,
  token TEXT NOT NULL);
CREATE TABLE journal(
  seq INTEGER PRIMARY KEY AUTOINCREMENT,
  save INTEGER NOT NULL,
  uid TEXT NOT NULL,
  change INTEGER NOT NULL);
CREATE TABLE cursors(program TEXT PRIMARY KEY, seq INTEGER NOT NULL) WITHOUT ROWID;
)";

// Switching a new file to WAL is the one step that does not wait for others by itself.
void switchToWAL(Sqlite& database) {
    for (int attempt = 0;; attempt++) {
        try {
            database.execute("PRAGMA journal_mode=WAL");
            return;
        } catch (const CXException&) {
            if (attempt == 100) throw;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    }
}

std::vector<std::pair<int64_t, UniqueId>> numbered(Sqlite::Statement& s, const RecordStore::Naming& name = {}) {
    std::vector<std::pair<int64_t, UniqueId>> all;
    while (s.step()) all.emplace_back(s.integer(0), name ? name(s.textView(1)) : UniqueId(s.textView(1)));
    return all;
}

bool isOlder(const std::pair<int64_t, UniqueId>& a, const std::pair<int64_t, UniqueId>& b) {
    return a.first < b.first;
}

// Of "id, uid, location, created, modified, properties, writer".
CXRow rowOf(Sqlite::Statement& s) {
    CXRow row;
    row.uniqueId = UniqueId(s.text(1));
    row.sharingUniqueId = cxNormalizedUID(row.uniqueId);
    row.location = RemoteLocation(s.text(2));
    row.created = Date(s.real(3));
    row.modified = Date(s.real(4));
    row.encoded = std::make_shared<const Bytes>(s.bytes(5));
    row.writer = s.text(6);
    return row;
}

} // namespace

const std::string& RecordStore::makeIfMissing(const std::string& path, int busyTimeoutMilliseconds) {
    struct stat there {};
    if (::stat(path.c_str(), &there) == 0) {
        if (S_ISREG(there.st_mode) && there.st_size == 0)
            throw CXException(kCXDatabaseException,
                              "The contact database " + path +
                                  " is empty (0 bytes): what stood in it is lost. Put a backup in "
                                  "its place, or begin anew with `rolvane new-database`.");
        return path;
    }
    if (errno != ENOENT) return path; // the opening says why
    static std::atomic<int> made = 0;
    const std::string fresh = path + ".new." + std::to_string(::getpid()) + "." + std::to_string(++made);
    {
        Sqlite database(fresh, busyTimeoutMilliseconds, throwDatabaseError);
        const RecordStore filled(database);
    }
    // Never over another process's, which was faster.
    int failed = ::link(fresh.c_str(), path.c_str()) == 0 ? 0 : errno;
    if (failed != 0 && failed != EEXIST) // a file system without links
        failed = ::renameat2(AT_FDCWD, fresh.c_str(), AT_FDCWD, path.c_str(), RENAME_NOREPLACE) == 0 ? 0 : errno;
    ::unlink(fresh.c_str());
    if (failed != 0 && failed != EEXIST)
        throw CXException(kCXDatabaseException, "Could not make the contact database " + path + ": " +
                                                    std::strerror(failed) +
                                                    ". Check the permissions of its directory.");
    return path;
}

RecordStore::RecordStore(Sqlite& database) : _database(database) {
    makeOrCheckFormat();
    _database.execute("PRAGMA synchronous=FULL; PRAGMA foreign_keys=ON; PRAGMA cache_size=-8000;");
    if (isLeftOut("sync")) _database.execute("PRAGMA synchronous=OFF");
}

void RecordStore::makeOrCheckFormat() {
    auto isNew = [this] {
        return _database.integer("PRAGMA user_version") == 0 &&
               _database.integer("SELECT count(*) FROM sqlite_master") == 0;
    };
    if (isNew()) {
        switchToWAL(_database);
        _database.execute("PRAGMA synchronous=FULL");
        SqliteTransaction transaction(_database);
        if (isNew()) fillNewDatabase(); // nobody else made it meanwhile
        transaction.commit();
    }
    if (_database.integer("PRAGMA application_id") != kApplicationId)
        throw CXException(kCXDatabaseException, "The file " + _database.path() +
                                                    " is no contact database. Name another file or move it away.");
    int64_t format = _database.integer("PRAGMA user_version");
    if (format == 1) format = addWriters();
    if (format == 2) format = addNames();
    if (format == 3) format = addCommonVersions();
    if (format == 4) format = addDisplayNames();
    if (format == 5) format = addDaemonMemory();
    if (format == 6) format = addSearchTexts();
    if (format == 7) format = addChangeLog();
    if (format == 8) format = moveDaemonMemory();
    if (format > kFormat)
        throw CXException(kCXDatabaseException, "The contact database " + _database.path() +
                                                    " was written by a newer version (format " +
                                                    std::to_string(format) + ", this version knows " +
                                                    std::to_string(kFormat) + "). Install that version to open it.");
}

// Format 1 did not say which program wrote a row.
int64_t RecordStore::addWriters() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 1) // nobody else did it meanwhile
        _database.execute(
            "ALTER TABLE records ADD COLUMN writer TEXT NOT NULL DEFAULT ''; DROP INDEX records_location; "
            "CREATE INDEX records_location ON records(kind, location, id, uid); PRAGMA user_version=2;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Format 2 could name a group's members only by a look at each member's row.
int64_t RecordStore::addNames() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 2) // nobody else did it meanwhile
        _database.execute("CREATE INDEX IF NOT EXISTS records_names ON records(id, uid, kind); PRAGMA user_version=3;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Format 3 did not keep what an edited contact was before. Nothing is known of what stores have had by then.
int64_t RecordStore::addCommonVersions() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 3) // nobody else did it meanwhile
        _database.execute(std::string(CommonVersions::kTable) + ConflictLog::kTable + "PRAGMA user_version=4;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Format 4 found a person by name only by a look at everybody.
int64_t RecordStore::addDisplayNames() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 4) // nobody else did it meanwhile
        _database.execute("CREATE INDEX IF NOT EXISTS records_display ON "
                          "records(display COLLATE NOCASE, kind, uid, location, sort); PRAGMA user_version=5;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Up to format 5 the daemon's memory was in the preferences, from where it moves as it is used.
int64_t RecordStore::addDaemonMemory() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 5) // nobody else did it meanwhile
        _database.execute(std::string(MemoryTable::kTable) + "PRAGMA user_version=6;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Up to format 6 the search text knew accents, and neither notes nor the digits of phones; it was read with the rows.
int64_t RecordStore::addSearchTexts() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 6) { // nobody else did it meanwhile
        auto set = _database.statement("UPDATE records SET search=?2 WHERE id=?1");
        forEachRowOfTable(
            [&](const TableRow& row) {
                Dictionary properties;
                try {
                    properties = BinaryValue::decode(row.properties).dictionary();
                } catch (const CXException&) { // whoever reads the row is told
                    return;
                }
                set.bind(1, row.id).bind(2, std::string_view(deriveColumns(row.kind, properties).search)).run();
                set.reset();
            },
            true);
        _database.execute("CREATE INDEX IF NOT EXISTS records_search ON records(id, kind, search); "
                          "PRAGMA user_version=7;");
    }
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Format 7 did not keep what changes had changed.
int64_t RecordStore::addChangeLog() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 7) // nobody else did it meanwhile
        _database.execute(std::string(ChangeLog::kTable) + "PRAGMA user_version=8;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

// Up to format 8 the values of the daemon's memory lay among its keys.
int64_t RecordStore::moveDaemonMemory() {
    SqliteTransaction transaction(_database);
    if (_database.integer("PRAGMA user_version") == 8) // nobody else did it meanwhile
        _database.execute(std::string("ALTER TABLE daemon RENAME TO former_daemon;") + MemoryTable::kTable +
                          "INSERT INTO daemon SELECT key, value FROM former_daemon; DROP TABLE former_daemon; "
                          "PRAGMA user_version=9;");
    transaction.commit();
    return _database.integer("PRAGMA user_version");
}

void RecordStore::fillNewDatabase() {
    _database.execute(std::string(kTables) + CommonVersions::kTable + ConflictLog::kTable + MemoryTable::kTable +
                      ChangeLog::kTable);
    _database.execute("PRAGMA application_id=" + std::to_string(kApplicationId));
    _database.execute("PRAGMA user_version=" + std::to_string(kFormat));
    _database.statement("INSERT INTO meta VALUES('identity', ?)").bind(1, makeUUID()).run();
    // A share count that no other new database is likely to have: a new file is noticed as another one.
    int64_t count = 0;
    for (char c : makeUUID().substr(0, 6)) count = count * 37 + c;
    _database.statement("INSERT INTO meta VALUES('shareCount', ?)").bind(1, count % 1000000000).run();
    Date now = Clock::system().now();
    const auto add = [&](const UniqueId& uid, RecordKind kind, const Dictionary& properties) {
        insertRow(uid, kind, properties, BinaryValue::encode(properties), now, "");
    };
    add(UniqueId(kCXAllGroupUID), RecordKind::allGroup,
        {{kCXGroupNameProperty, defaultGroupName(RecordKind::allGroup)}});
    add(makeUniqueId(kCXSubscriptionTable), RecordKind::subscription,
        {{kCXRemoteLocationProperty, kCXLocalRemoteLocation}, {kCXSubscriptionIsAllProperty, false}});
}

uint64_t RecordStore::generation() {
    return (_ownWrites << 32) + static_cast<uint64_t>(_database.integer("PRAGMA data_version"));
}

std::string RecordStore::identity() {
    auto s = _database.statement("SELECT value FROM meta WHERE key='identity'");
    return s.step() ? s.text(0) : "";
}

int64_t RecordStore::shareCount() {
    return _database.integer("SELECT value FROM meta WHERE key='shareCount'");
}

void RecordStore::setShareCount(int64_t count) {
    _database.statement("INSERT OR REPLACE INTO meta VALUES('shareCount', ?)").bind(1, count).run();
}

std::optional<StoredRow> RecordStore::row(const UniqueId& uid) {
    auto s = _database.statement("SELECT id, uid, kind, location, created, modified, properties, writer FROM records "
                                 "WHERE uid=?");
    if (!s.bind(1, uid.str()).step()) return std::nullopt;
    StoredRow row;
    row.id = s.integer(0);
    row.uid = UniqueId(s.text(1));
    row.kind = static_cast<RecordKind>(s.integer(2));
    row.location = s.text(3);
    row.created = Date(s.real(4));
    row.modified = Date(s.real(5));
    row.properties = std::make_shared<const Bytes>(s.bytes(6));
    row.writer = s.text(7);
    return row;
}

int64_t RecordStore::rowNumber(const UniqueId& uid) {
    auto s = _database.statement("SELECT id FROM records WHERE uid=?");
    return s.bind(1, uid.str()).step() ? s.integer(0) : 0;
}

std::pair<int64_t, RecordKind> RecordStore::numberAndKind(const UniqueId& uid) {
    auto s = _database.statement("SELECT id, kind FROM records WHERE uid=?");
    if (!s.bind(1, uid.str()).step()) return {0, RecordKind::none};
    return {s.integer(0), static_cast<RecordKind>(s.integer(1))};
}

std::optional<UniqueId> RecordStore::firstOfLocation(RecordKind kind, std::string_view location) {
    auto s = _database.statement("SELECT uid FROM records WHERE kind=? AND location=? ORDER BY id LIMIT 1");
    if (!s.bind(1, static_cast<int>(kind)).bind(2, location).step()) return std::nullopt;
    return UniqueId(s.text(0));
}

std::vector<std::pair<int64_t, UniqueId>>
RecordStore::recordsOf(RecordKind kind, const std::optional<std::string>& location, const Naming& name) {
    // Read from the index alone, so that listing everybody does not walk over everybody's data.
    auto s = _database.statement(
        location ? "SELECT id, uid FROM records INDEXED BY records_location WHERE kind=?1 AND location=?2"
                 : "SELECT id, uid FROM records INDEXED BY records_location WHERE kind=?1");
    s.bind(1, static_cast<int>(kind));
    if (location) s.bind(2, std::string_view(*location));
    auto all = numbered(s, name);
    if (!std::is_sorted(all.begin(), all.end(), isOlder)) std::sort(all.begin(), all.end(), isOlder);
    return all;
}

std::vector<std::pair<UniqueId, RecordKind>> RecordStore::listed(const UniqueId& group) {
    auto s = _database.statement(
        "SELECT r.uid, r.kind FROM listed l CROSS JOIN records r INDEXED BY records_names "
        "ON r.id=l.member_id WHERE l.group_id=(SELECT id FROM records WHERE uid=?) ORDER BY l.position");
    s.bind(1, group.str());
    std::vector<std::pair<UniqueId, RecordKind>> all;
    while (s.step()) all.emplace_back(UniqueId(s.text(0)), static_cast<RecordKind>(s.integer(1)));
    return all;
}

bool RecordStore::isListed(const UniqueId& group, const UniqueId& member) {
    auto s = _database.statement("SELECT 1 FROM listed WHERE member_id=(SELECT id FROM records WHERE uid=?1) "
                                 "AND group_id=(SELECT id FROM records WHERE uid=?2)");
    return s.bind(1, member.str()).bind(2, group.str()).step();
}

int64_t RecordStore::countMembers(const UniqueId& group) {
    auto s = _database.statement(
        "SELECT count(*) FROM listed l CROSS JOIN records r INDEXED BY records_names "
        "ON r.id=l.member_id WHERE l.group_id=(SELECT id FROM records WHERE uid=?) AND r.kind IN (1,2)");
    s.bind(1, group.str()).step();
    return s.integer(0);
}

int64_t RecordStore::countOf(RecordKind kind, const std::optional<std::string>& location) {
    auto s = _database.statement(location ? "SELECT count(*) FROM records WHERE kind=?1 AND location=?2"
                                          : "SELECT count(*) FROM records WHERE kind=?1");
    s.bind(1, static_cast<int>(kind));
    if (location) s.bind(2, std::string_view(*location));
    s.step();
    return s.integer(0);
}

std::vector<std::pair<int64_t, UniqueId>> RecordStore::parents(const UniqueId& member) {
    auto s = _database.statement("SELECT g.id, g.uid FROM listed l JOIN records g ON g.id=l.group_id "
                                 "WHERE l.member_id=(SELECT id FROM records WHERE uid=?) ORDER BY g.id");
    s.bind(1, member.str());
    return numbered(s);
}

namespace {

// Is the property among the keys of an encoded dictionary?
bool usesProperty(const Bytes& encoded, const std::string& property) {
    return BinaryValue::decode(encoded).dictionary().contains(property);
}

} // namespace

std::vector<StoredChoice> RecordStore::choicesOfGroup(const UniqueId& group) {
    auto s = _database.statement(
        "SELECT p.uid, c.property, c.identifier, p.properties FROM choices c JOIN records p ON p.id=c.person_id "
        "WHERE c.group_id=(SELECT id FROM records WHERE uid=?1) AND EXISTS "
        "(SELECT 1 FROM listed l WHERE l.member_id=c.person_id AND l.group_id=c.group_id)");
    s.bind(1, group.str());
    std::vector<StoredChoice> all;
    while (s.step()) {
        StoredChoice choice{UniqueId(s.text(0)), s.text(1), s.text(2), true};
        choice.propertyIsUsed = usesProperty(s.bytes(3), choice.property);
        all.push_back(std::move(choice));
    }
    return all;
}

std::vector<StoredChoice> RecordStore::choicesOfPerson(const UniqueId& person) {
    auto s = _database.statement("SELECT g.uid, c.property, c.identifier FROM choices c "
                                 "JOIN records g ON g.id=c.group_id "
                                 "WHERE c.person_id=(SELECT id FROM records WHERE uid=?)");
    s.bind(1, person.str());
    std::vector<StoredChoice> all;
    while (s.step()) all.push_back({UniqueId(s.text(0)), s.text(1), s.text(2), true});
    return all;
}

std::optional<std::string> RecordStore::choice(const UniqueId& group, const UniqueId& person,
                                               std::string_view property) {
    auto s = _database.statement("SELECT identifier FROM choices WHERE group_id=(SELECT id FROM records WHERE uid=?1) "
                                 "AND person_id=(SELECT id FROM records WHERE uid=?2) AND property=?3");
    if (!s.bind(1, group.str()).bind(2, person.str()).bind(3, property).step()) return std::nullopt;
    return s.text(0);
}

// In two steps, each of which finds its place by index: the rest of the rows with the position's own date, then the
// rows behind that date. One save gives all its records one date, so that a comparison of (date, number) pairs would
// walk over the whole save again for every page.
std::vector<CXRow> RecordStore::scan(RecordKind kind, ScanPosition& position, int limit, bool withParents) {
    SqliteSnapshot snapshot(_database);
    std::vector<CXRow> rows;
    std::vector<int64_t> ids;
    const double date = position.modified;
    const auto take = [&](Sqlite::Statement& s) {
        while (s.step()) {
            const ScanPosition next{s.real(4), s.integer(0)};
            const bool isBehind =
                next.modified > position.modified || (next.modified == position.modified && next.id > position.id);
            if (!isBehind) outOfOrder();
            position = next;
            ids.push_back(position.id);
            rows.push_back(rowOf(s));
        }
    };
    auto sameDate = _database.statement("SELECT id, uid, location, created, modified, properties, writer FROM records "
                                        "WHERE kind=?1 AND modified=?2 AND id>?3 ORDER BY id LIMIT ?4");
    sameDate.bind(1, static_cast<int>(kind)).bind(2, date).bind(3, position.id).bind(4, limit);
    take(sameDate);
    auto later = _database.statement("SELECT id, uid, location, created, modified, properties, writer FROM records "
                                     "WHERE kind=?1 AND modified>?2 ORDER BY modified, id LIMIT ?3");
    later.bind(1, static_cast<int>(kind)).bind(2, date).bind(3, limit - static_cast<int>(rows.size()));
    take(later);
    if (withParents) addParents(rows, ids);
    return rows;
}

std::vector<CXRow> RecordStore::scanMembers(const UniqueId& group, int64_t& position, int limit) {
    SqliteSnapshot snapshot(_database);
    auto s = _database.statement(
        "SELECT r.id, r.uid, r.location, r.created, r.modified, r.properties, r.writer, l.position "
        "FROM listed l CROSS JOIN records r ON r.id=l.member_id WHERE l.group_id=(SELECT id FROM records WHERE uid=?1) "
        "AND l.position>?2 AND r.kind IN (1,2) ORDER BY l.position LIMIT ?3");
    s.bind(1, group.str()).bind(2, position).bind(3, limit);
    return rowsWithParents(s, 7, position);
}

std::vector<CXRow> RecordStore::scanByAge(RecordKind kind, const std::optional<std::string>& location,
                                          int64_t& position, int limit) {
    SqliteSnapshot snapshot(_database);
    auto s = _database.statement(
        location ? "SELECT id, uid, location, created, modified, properties, writer FROM records INDEXED BY "
                   "records_location "
                   "WHERE kind=?1 AND location=?4 AND id>?2 ORDER BY id LIMIT ?3"
                 : "SELECT id, uid, location, created, modified, properties, writer FROM records NOT INDEXED "
                   "WHERE kind=?1 AND id>?2 ORDER BY id LIMIT ?3");
    s.bind(1, static_cast<int>(kind)).bind(2, position).bind(3, limit);
    if (location) s.bind(4, std::string_view(*location));
    return rowsWithParents(s, 0, position);
}

// A scan that does not move on would never end.
void RecordStore::outOfOrder() {
    const std::string told = "The contact database " + _database.path() + " is damaged: an index is out of order.";
    _database.noteDamage(told);
    throw CXDamagedDatabase(told);
}

std::vector<CXRow> RecordStore::rowsWithParents(Sqlite::Statement& s, int positionColumn, int64_t& position) {
    std::vector<CXRow> rows;
    std::vector<int64_t> ids;
    while (s.step()) {
        const int64_t next = s.integer(positionColumn);
        if (next <= position) outOfOrder();
        position = next;
        ids.push_back(s.integer(0));
        rows.push_back(rowOf(s));
    }
    addParents(rows, ids);
    return rows;
}

// One query for all rows: their numbers go in as a list.
void RecordStore::addParents(std::vector<CXRow>& rows, const std::vector<int64_t>& ids) {
    if (ids.empty()) return;
    std::string list = "[";
    for (const int64_t id : ids) list.append(std::to_string(id)).append(",");
    list.back() = ']';
    auto s = _database.statement("SELECT e.key, g.id, g.uid FROM json_each(?1) e CROSS JOIN listed l ON "
                                 "l.member_id=e.value CROSS JOIN records g ON g.id=l.group_id ORDER BY 1, 2");
    s.bind(1, std::string_view(list));
    std::map<int64_t, UniqueId> groups; // few: their texts are shared by all rows
    while (s.step()) {
        UniqueId& group = groups[s.integer(1)];
        if (group.empty()) group = UniqueId(s.text(2));
        rows[static_cast<size_t>(s.integer(0))].parentGroups.push_back(group);
    }
}

std::vector<RecordStore::Line> RecordStore::linesNamed(std::string_view name, bool partOfName) {
    auto s =
        _database.statement(partOfName ? "SELECT uid, location, display, sort FROM records INDEXED BY records_display "
                                         "WHERE kind IN (1,2) AND instr(lower(display), lower(?1)) > 0"
                                       : "SELECT uid, location, display, sort FROM records INDEXED BY records_display "
                                         "WHERE display=?1 COLLATE NOCASE AND kind IN (1,2)");
    s.bind(1, name);
    std::vector<Line> lines;
    while (s.step()) lines.push_back({UniqueId(s.text(0)), s.text(1), s.text(2), s.text(3), ""});
    return lines;
}

std::vector<RecordStore::Line> RecordStore::linesBegun(std::string_view start, size_t most) {
    const std::string behind = std::string(start) + "\xFF"; // no UTF-8 text has this byte
    SqliteSnapshot snapshot(_database);
    std::vector<Line> lines;
    const auto read = [&](const char* order, size_t limit) {
        auto s = _database.statement("SELECT uid, location, display, sort FROM records INDEXED BY records_display "
                                     "WHERE display>=?1 COLLATE NOCASE AND display<?2 COLLATE NOCASE "
                                     "AND kind IN (1,2) ORDER BY display COLLATE NOCASE " +
                                     std::string(order) + " LIMIT ?3");
        s.bind(1, start).bind(2, std::string_view(behind)).bind(3, static_cast<int64_t>(limit));
        while (s.step()) lines.push_back({UniqueId(s.text(0)), s.text(1), s.text(2), s.text(3), ""});
    };
    read("ASC", most + 1);
    if (lines.size() <= most) return lines;
    lines.resize(most - 1);
    read("DESC", 1);
    return lines;
}

std::vector<RecordStore::Line> RecordStore::linesFound(const std::function<bool(std::string_view)>& passes) {
    SqliteSnapshot snapshot(_database);
    std::vector<int64_t> ids;
    auto texts = _database.statement("SELECT id, kind, search FROM records INDEXED BY records_search");
    while (texts.step())
        if (isPerson(static_cast<RecordKind>(texts.integer(1))) && passes(texts.textView(2)))
            ids.push_back(texts.integer(0));
    auto row = _database.statement("SELECT uid, location, display, sort FROM records WHERE id=?");
    std::vector<Line> lines;
    for (const int64_t id : ids) {
        if (row.bind(1, id).step()) lines.push_back({UniqueId(row.text(0)), row.text(1), row.text(2), row.text(3), ""});
        row.reset();
    }
    return lines;
}

std::vector<UniqueId> RecordStore::peopleWhoseIdentifierBegins(std::string_view start) {
    auto s = _database.statement("SELECT uid FROM records INDEXED BY records_names "
                                 "WHERE kind IN (1,2) AND substr(uid, 1, length(?1))=?1 COLLATE NOCASE");
    s.bind(1, start);
    std::vector<UniqueId> uids;
    while (s.step()) uids.emplace_back(s.text(0));
    return uids;
}

std::vector<CXRow> RecordStore::rowsOf(std::span<const UniqueId> uids, size_t& taken) {
    constexpr size_t kMostBytes = 8 << 20; // photos make contacts large
    SqliteSnapshot snapshot(_database);
    size_t bytes = 0;
    taken = 0;
    std::vector<CXRow> rows;
    std::vector<int64_t> ids;
    auto s = _database.statement("SELECT id, uid, location, created, modified, properties, writer FROM records "
                                 "WHERE uid=?1 AND kind IN (1,2)");
    for (const UniqueId& uid : uids) {
        if (bytes > kMostBytes) break;
        ++taken;
        s.bind(1, uid.str());
        if (s.step()) {
            ids.push_back(s.integer(0));
            rows.push_back(rowOf(s));
            bytes += rows.back().encoded->size();
        }
        s.reset();
    }
    addParents(rows, ids);
    return rows;
}

void RecordStore::forEachLine(RecordKind kind, const std::function<void(Line)>& call) {
    auto s = _database.statement("SELECT uid, location, display, sort, search FROM records WHERE kind=? ORDER BY id");
    s.bind(1, static_cast<int>(kind));
    while (s.step()) call({UniqueId(s.text(0)), s.text(1), s.text(2), s.text(3), s.text(4)});
}

} // namespace rolvane
