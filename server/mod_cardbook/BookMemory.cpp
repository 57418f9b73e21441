#include "server/mod_cardbook/BookMemory.h"

#include "contacts/records/Identifier.h"
#include "server/mod_cardbook/Place.h"

#include <cstdlib>

namespace rolvane::cardbook {
namespace {

// 1 had no table joined; in 2, looks were noted of devices that had been told of tags alone; 3 had no table waiting, 4
// no table told
constexpr int kFormat = 5;
constexpr const char* kTables = R"(
CREATE TABLE meta(key TEXT PRIMARY KEY, value) WITHOUT ROWID;
CREATE TABLE books(id INTEGER PRIMARY KEY, book TEXT NOT NULL UNIQUE, seq INTEGER NOT NULL, begun INTEGER NOT NULL,
  forgotten INTEGER NOT NULL DEFAULT 0);
CREATE TABLE members(
  book INTEGER NOT NULL,
  uid TEXT NOT NULL,
  name TEXT NOT NULL,
  modified REAL NOT NULL,
  seq INTEGER NOT NULL,
  gone INTEGER NOT NULL DEFAULT 0,
  seen INTEGER NOT NULL DEFAULT 0,
  PRIMARY KEY(book, uid)) WITHOUT ROWID;
CREATE UNIQUE INDEX members_name ON members(book, name);
CREATE UNIQUE INDEX members_seq ON members(book, seq);
CREATE INDEX members_uid ON members(uid);
CREATE INDEX members_gone ON members(seq) WHERE gone;
CREATE TABLE wishes(book INTEGER NOT NULL, uid TEXT NOT NULL, name TEXT NOT NULL, PRIMARY KEY(book, uid)) WITHOUT ROWID;
CREATE TABLE written(uid TEXT NOT NULL, digest BLOB NOT NULL, version INTEGER NOT NULL, text BLOB NOT NULL,
  PRIMARY KEY(uid, digest));
CREATE TABLE looks(device TEXT NOT NULL, book TEXT NOT NULL, seq INTEGER NOT NULL, date REAL NOT NULL, PRIMARY KEY(device, book)) WITHOUT ROWID;
CREATE TABLE had(device TEXT NOT NULL, uid TEXT NOT NULL, date REAL NOT NULL, PRIMARY KEY(device, uid)) WITHOUT ROWID;
CREATE TABLE knows(device TEXT NOT NULL, property TEXT NOT NULL, PRIMARY KEY(device, property)) WITHOUT ROWID;
)";
constexpr const char* kJoinedTable = R"(
CREATE TABLE joined(key TEXT NOT NULL, uid TEXT NOT NULL, PRIMARY KEY(key, uid)) WITHOUT ROWID;
CREATE INDEX joined_uid ON joined(uid);
)";
constexpr const char* kToldTable = R"(
CREATE TABLE told(device TEXT NOT NULL, book TEXT NOT NULL, uid TEXT NOT NULL, seq INTEGER NOT NULL, PRIMARY KEY(device, book, uid)) WITHOUT ROWID;
)";
constexpr const char* kWaitingTable = R"(
CREATE TABLE waiting(key TEXT NOT NULL, uid TEXT NOT NULL, PRIMARY KEY(key, uid)) WITHOUT ROWID;
CREATE INDEX waiting_uid ON waiting(uid);
)";

Member memberAt(const Sqlite::Statement& s) {
    return {UniqueId(s.textView(0)), s.text(1), Date(s.real(2)), s.integer(3), s.integer(4) != 0};
}

} // namespace

BookMemory::BookMemory(const std::string& path, int busyTimeoutMilliseconds, int64_t departuresKept)
    : _sqlite(path, busyTimeoutMilliseconds), _departuresKept(departuresKept) {
    if (_sqlite.integer("PRAGMA user_version") == kFormat) return;
    _sqlite.execute("PRAGMA journal_mode=WAL");
    SqliteTransaction transaction(_sqlite);
    const int64_t format = _sqlite.integer("PRAGMA user_version");
    if (format < 0 || format > kFormat)
        throw CXException(kCXDatabaseException, path + " was written by a newer version of this program.");
    if (format == kFormat) return; // another process was faster
    if (format < 2) _sqlite.execute(kJoinedTable);
    if (format < 4) _sqlite.execute(kWaitingTable);
    _sqlite.execute(kToldTable);
    _sqlite.execute("PRAGMA user_version=" + std::to_string(kFormat));
    if (format > 0) {
        if (format < 4) _sqlite.execute("DELETE FROM meta WHERE key='position'"); // everybody is looked at once more
        if (format < 3) _sqlite.execute("DELETE FROM looks");
        transaction.commit();
        return;
    }
    _sqlite.execute(kTables);
    auto s = _sqlite.statement("SELECT lower(hex(randomblob(8)))");
    s.step();
    set("epoch", s.text(0));
    transaction.commit();
}

std::string BookMemory::setting(std::string_view key) {
    auto s = _sqlite.statement("SELECT value FROM meta WHERE key=?");
    return s.bind(1, key).step() ? s.text(0) : "";
}

void BookMemory::set(std::string_view key, std::string_view value) {
    _sqlite.statement("INSERT OR REPLACE INTO meta VALUES(?,?)").bind(1, key).bind(2, value).run();
}

std::string BookMemory::epoch() {
    return setting("epoch");
}

int64_t BookMemory::forgottenUntil(std::string_view book) {
    auto s = _sqlite.statement("SELECT forgotten FROM books WHERE book=?");
    return s.bind(1, book).step() ? s.integer(0) : 0;
}

int64_t BookMemory::latest(std::string_view book) {
    auto s = _sqlite.statement("SELECT seq FROM books WHERE book=?");
    return s.bind(1, book).step() ? s.integer(0) : 0;
}

int64_t BookMemory::position() {
    const std::string text = setting("position");
    return text.empty() ? -1 : std::strtoll(text.c_str(), nullptr, 10);
}

Bytes BookMemory::history() {
    auto s = _sqlite.statement("SELECT value FROM meta WHERE key='history'");
    return s.step() ? s.bytes(0) : Bytes();
}

BookMemory::Change::Change(BookMemory& memory) : _memory(memory), _transaction(memory._sqlite) {
    _memory._sequence = std::strtoll(_memory.setting("sequence").c_str(), nullptr, 10);
}

BookMemory::Change::~Change() {
    _memory._comparison = 0;
}

void BookMemory::Change::commit() {
    _memory.set("sequence", std::to_string(_memory._sequence));
    _transaction.commit();
}

int64_t BookMemory::nextSequence() {
    return ++_sequence;
}

int64_t BookMemory::numberOf(std::string_view book, bool make) {
    {
        auto s = _sqlite.statement("SELECT id FROM books WHERE book=?");
        if (s.bind(1, book).step()) return s.integer(0);
    }
    if (!make) return 0;
    auto s = _sqlite.statement("INSERT INTO books(book, seq, begun) VALUES(?1, ?2, ?2)");
    s.bind(1, book).bind(2, nextSequence()).run();
    return _sqlite.lastInsertId();
}

int64_t BookMemory::begun(std::string_view book) {
    auto s = _sqlite.statement("SELECT begun FROM books WHERE book=?");
    return s.bind(1, book).step() ? s.integer(0) : 0;
}

void BookMemory::ensureBook(std::string_view book) {
    numberOf(book, true);
}

// Reading ----------------------------------------------------------------------------------------------------------

std::optional<Member> BookMemory::named(std::string_view book, std::string_view name) {
    auto s = _sqlite.statement("SELECT uid, name, modified, seq, gone FROM members "
                               "WHERE book=(SELECT id FROM books WHERE book=?1) AND name=?2 AND NOT gone");
    if (!s.bind(1, book).bind(2, name).step()) return std::nullopt;
    return memberAt(s);
}

std::optional<Member> BookMemory::of(std::string_view book, const UniqueId& uid) {
    auto s = _sqlite.statement("SELECT uid, name, modified, seq, gone FROM members "
                               "WHERE book=(SELECT id FROM books WHERE book=?1) AND uid=?2 AND NOT gone");
    if (!s.bind(1, book).bind(2, uid.str()).step()) return std::nullopt;
    return memberAt(s);
}

std::optional<Member> BookMemory::departed(std::string_view book, std::string_view name) {
    auto s = _sqlite.statement("SELECT uid, name, modified, seq, gone FROM members "
                               "WHERE book=(SELECT id FROM books WHERE book=?1) AND name=?2 AND gone");
    if (!s.bind(1, book).bind(2, name).step()) return std::nullopt;
    return memberAt(s);
}

std::vector<Member> BookMemory::after(std::string_view book, int64_t sequence, bool withGone, size_t limit) {
    auto s = _sqlite.statement("SELECT uid, name, modified, seq, gone FROM members INDEXED BY members_seq "
                               "WHERE book=(SELECT id FROM books WHERE book=?1) AND seq>?2 AND gone<=?3 "
                               "ORDER BY seq LIMIT ?4");
    s.bind(1, book).bind(2, sequence).bind(3, withGone ? 1 : 0).bind(4, static_cast<int64_t>(limit));
    std::vector<Member> all;
    while (s.step()) all.push_back(memberAt(s));
    return all;
}

std::vector<std::string> BookMemory::booksWith(const UniqueId& uid) {
    auto s = _sqlite.statement("SELECT b.book FROM members m JOIN books b ON b.id=m.book WHERE m.uid=? AND NOT m.gone");
    s.bind(1, uid.str());
    std::vector<std::string> all;
    while (s.step()) all.push_back(s.text(0));
    return all;
}

std::vector<std::string> BookMemory::books() {
    auto s = _sqlite.statement("SELECT book FROM books ORDER BY id");
    std::vector<std::string> all;
    while (s.step()) all.push_back(s.text(0));
    return all;
}

std::vector<UniqueId> BookMemory::uidsOf(std::string_view book) {
    auto s = _sqlite.statement("SELECT uid FROM members WHERE book=(SELECT id FROM books WHERE book=?) AND NOT gone");
    s.bind(1, book);
    std::vector<UniqueId> all;
    while (s.step()) all.emplace_back(s.textView(0));
    return all;
}

// Writing ----------------------------------------------------------------------------------------------------------

void BookMemory::setPosition(int64_t position, const Bytes& history) {
    set("position", std::to_string(position));
    _sqlite.statement("INSERT OR REPLACE INTO meta VALUES('history',?)").bind(1, history).run();
}

bool BookMemory::isTaken(int64_t book, std::string_view name, const UniqueId& uid) {
    auto s = _sqlite.statement("SELECT 1 FROM members WHERE book=?1 AND name=?2 AND NOT gone AND uid<>?3");
    return s.bind(1, book).bind(2, name).bind(3, uid.str()).step();
}

// As its client wished, else as "Contacts" has it, else by its identifier.
std::string BookMemory::nameFor(int64_t book, const UniqueId& uid) {
    std::string name;
    {
        auto s = _sqlite.statement("SELECT name FROM wishes WHERE book=?1 AND uid=?2");
        if (s.bind(1, book).bind(2, uid.str()).step()) name = s.text(0);
    }
    if (name.empty())
        if (const auto elsewhere = of(kContactsBook, uid)) name = elsewhere->name;
    if (!name.empty() && !isTaken(book, name, uid)) return name;
    const std::string own(cxUUIDPart(uid));
    name = own + ".vcf";
    for (int n = 2; isTaken(book, name, uid); ++n) name = own + "-" + std::to_string(n) + ".vcf";
    return name;
}

bool BookMemory::note(std::string_view book, const UniqueId& uid, Date modified) {
    const int64_t number = numberOf(book, true);
    std::string name;
    {
        auto s = _sqlite.statement("SELECT name, modified, gone FROM members WHERE book=?1 AND uid=?2");
        if (s.bind(1, number).bind(2, uid.str()).step() && s.integer(2) == 0) {
            name = s.text(0);
            if (Date(s.real(1)) == modified) {
                if (_comparison == 0) return false;
                auto seen = _sqlite.statement("UPDATE members SET seen=?3 WHERE book=?1 AND uid=?2");
                seen.bind(1, number).bind(2, uid.str()).bind(3, _comparison).run();
                return false;
            }
        }
    }
    if (name.empty()) name = nameFor(number, uid);
    const int64_t sequence = nextSequence();
    _sqlite.statement("DELETE FROM members WHERE book=?1 AND name=?2 AND uid<>?3 AND gone")
        .bind(1, number)
        .bind(2, name)
        .bind(3, uid.str())
        .run();
    auto s = _sqlite.statement("INSERT OR REPLACE INTO members VALUES(?,?,?,?,?,0,?)");
    s.bind(1, number).bind(2, uid.str()).bind(3, name).bind(4, modified.secondsSince1970()).bind(5, sequence);
    s.bind(6, _comparison).run();
    _sqlite.statement("UPDATE books SET seq=?2 WHERE id=?1").bind(1, number).bind(2, sequence).run();
    return true;
}

bool BookMemory::noteGone(std::string_view book, const UniqueId& uid) {
    if (!leave(book, uid)) return false;
    _sqlite
        .statement("DELETE FROM written WHERE uid=?1 AND NOT EXISTS "
                   "(SELECT 1 FROM members m WHERE m.uid=?1 AND NOT m.gone)")
        .bind(1, uid.str())
        .run();
    return true;
}

bool BookMemory::leave(std::string_view book, const UniqueId& uid) {
    const int64_t number = numberOf(book, false);
    if (!of(book, uid)) return false;
    const int64_t sequence = nextSequence();
    auto s = _sqlite.statement("UPDATE members SET gone=1, seq=?3 WHERE book=?1 AND uid=?2");
    s.bind(1, number).bind(2, uid.str()).bind(3, sequence).run();
    _sqlite.statement("UPDATE books SET seq=?2 WHERE id=?1").bind(1, number).bind(2, sequence).run();
    return true;
}

void BookMemory::noteBookGone(std::string_view book) {
    const int64_t number = numberOf(book, false);
    _sqlite.statement("DELETE FROM members WHERE book=?").bind(1, number).run();
    _sqlite.statement("DELETE FROM wishes WHERE book=?").bind(1, number).run();
    _sqlite.statement("DELETE FROM told WHERE book=?").bind(1, book).run();
    _sqlite.statement("DELETE FROM books WHERE id=?").bind(1, number).run();
    _sqlite.execute("DELETE FROM written WHERE NOT EXISTS "
                    "(SELECT 1 FROM members m WHERE m.uid=written.uid AND NOT m.gone)");
}

void BookMemory::wish(std::string_view book, const UniqueId& uid, std::string_view name) {
    auto s = _sqlite.statement("INSERT OR REPLACE INTO wishes VALUES(?,?,?)");
    s.bind(1, numberOf(book, true)).bind(2, uid.str()).bind(3, name).run();
}

// Its former name leaves under an identifier that no record has.
void BookMemory::rename(std::string_view book, const Member& member, std::string_view name) {
    const int64_t number = numberOf(book, false);
    leave(book, member.uid); // the text stays the card's
    auto s = _sqlite.statement("UPDATE members SET uid=?3 WHERE book=?1 AND uid=?2");
    s.bind(1, number).bind(2, member.uid.str()).bind(3, "former:" + std::to_string(_sequence)).run();
    wish(book, member.uid, name);
    note(book, member.uid, member.modified);
}

void BookMemory::forgetOldDepartures() {
    const int64_t departures = _sqlite.integer("SELECT count(*) FROM members INDEXED BY members_gone WHERE gone");
    if (departures <= _departuresKept + _departuresKept / 10) return;
    int64_t until = 0;
    {
        auto s = _sqlite.statement("SELECT seq FROM members INDEXED BY members_gone WHERE gone ORDER BY seq "
                                   "LIMIT 1 OFFSET ?");
        if (s.bind(1, departures - _departuresKept - 1).step()) until = s.integer(0);
    }
    _sqlite
        .statement("UPDATE books SET forgotten=max(forgotten, coalesce("
                   "(SELECT max(seq) FROM members m WHERE m.book=books.id AND gone AND m.seq<=?), 0))")
        .bind(1, until)
        .run();
    _sqlite.statement("DELETE FROM members WHERE gone AND seq<=?").bind(1, until).run();
    _sqlite.statement("DELETE FROM told WHERE uid<>'' AND seq<=?").bind(1, until).run();
}

void BookMemory::beginComparison() {
    _comparison = nextSequence();
    _sqlite.execute("DELETE FROM waiting");
}

void BookMemory::endComparison() {
    std::vector<std::pair<std::string, UniqueId>> missing;
    {
        auto s = _sqlite.statement("SELECT b.book, m.uid FROM members m JOIN books b ON b.id=m.book "
                                   "WHERE NOT m.gone AND m.seen<>?");
        s.bind(1, _comparison);
        while (s.step()) missing.emplace_back(s.text(0), UniqueId(s.textView(1)));
    }
    for (const auto& [book, uid] : missing) noteGone(book, uid);
    _comparison = 0;
}

void BookMemory::setJoined(const UniqueId& uid, const std::vector<std::string>& keys) {
    _sqlite.statement("DELETE FROM joined WHERE uid=?").bind(1, uid.str()).run();
    for (const std::string& key : keys)
        _sqlite.statement("INSERT OR REPLACE INTO joined VALUES(?,?)").bind(1, key).bind(2, uid.str()).run();
}

std::optional<UniqueId> BookMemory::joinedAs(const std::string& key) {
    auto s = _sqlite.statement("SELECT uid FROM joined WHERE key=?");
    return s.bind(1, key).step() ? std::optional(UniqueId(s.textView(0))) : std::nullopt;
}

void BookMemory::setWaiting(const UniqueId& group, const std::set<std::string>& keys) {
    std::set<std::string> fresh = keys, former;
    {
        auto s = _sqlite.statement("SELECT key FROM waiting WHERE uid=?");
        s.bind(1, group.str());
        while (s.step())
            if (fresh.erase(s.text(0)) == 0) former.insert(s.text(0));
    }
    for (const std::string& key : former)
        _sqlite.statement("DELETE FROM waiting WHERE key=?1 AND uid=?2").bind(1, key).bind(2, group.str()).run();
    for (const std::string& key : fresh)
        _sqlite.statement("INSERT INTO waiting VALUES(?,?)").bind(1, key).bind(2, group.str()).run();
}

std::vector<UniqueId> BookMemory::waitingFor(const std::string& key) {
    auto s = _sqlite.statement("SELECT uid FROM waiting WHERE key=?");
    s.bind(1, key);
    std::vector<UniqueId> all;
    while (s.step()) all.emplace_back(s.textView(0));
    return all;
}

// Texts ------------------------------------------------------------------------------------------------------------

std::optional<WrittenCard> BookMemory::written(const UniqueId& uid, const Bytes& digest) {
    auto s = _sqlite.statement("SELECT version, text FROM written WHERE uid=?1 AND digest=?2");
    if (!s.bind(1, uid.str()).bind(2, digest).step()) return std::nullopt;
    return WrittenCard{s.text(1), s.integer(0) == 4};
}

bool BookMemory::hasWritten(const UniqueId& uid) {
    return _sqlite.statement("SELECT 1 FROM written WHERE uid=?").bind(1, uid.str()).step();
}

void BookMemory::setWritten(const UniqueId& uid, const Bytes& digest, const WrittenCard& card) {
    auto s = _sqlite.statement("INSERT OR REPLACE INTO written VALUES(?,?,?,?)");
    const Bytes text(card.text.begin(), card.text.end());
    s.bind(1, uid.str()).bind(2, digest).bind(3, card.isVersion4 ? 4 : 3).bind(4, text).run();
}

void BookMemory::keepWrittenOnly(const UniqueId& uid, const Bytes& digest) {
    auto s = _sqlite.statement("DELETE FROM written WHERE uid=?1 AND digest<>?2");
    s.bind(1, uid.str()).bind(2, digest).run();
}

} // namespace rolvane::cardbook
