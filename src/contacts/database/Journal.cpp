#include "contacts/database/Journal.h"

#include <algorithm>
#include <map>

namespace rolvane {

namespace {

constexpr int kSavesKept = 1000;
constexpr int64_t kEntriesKept = 1000;  // however far the cursors are
constexpr int64_t kBooksMayLag = 10000; // entries

CXJournalEntry entryAt(const Sqlite::Statement& s) {
    return {s.integer(0), UniqueId(s.text(1)), static_cast<CXChangeKind>(s.integer(2)),
            s.integer(3), s.text(4),           Date(s.real(5))};
}

UniqueId groupOfContents(const UniqueId& uid) {
    std::string_view table = cxTableName(uid);
    if (table == kCXGroupContentsTable) return cxUIDWithTableName(uid, kCXGroupTable);
    if (table == kCXSubscribedGroupContentsTable) return cxUIDWithTableName(uid, kCXSubscribedGroupTable);
    return {};
}

struct NetChange {
    bool inserted = false;
    CXChangeKind last = CXChangeKind::updated;
};

} // namespace

int64_t Journal::position() {
    return _database.integer("SELECT seq FROM sqlite_sequence WHERE name='journal'");
}

std::vector<CXJournalEntry> Journal::entries(int64_t after, size_t limit) {
    auto s = _database.statement("SELECT j.seq, j.uid, j.change, s.pid, s.program, s.date FROM journal j "
                                 "JOIN saves s ON s.id=j.save WHERE j.seq>? ORDER BY j.seq LIMIT ?");
    s.bind(1, after).bind(2, static_cast<int64_t>(limit));
    std::vector<CXJournalEntry> all;
    while (s.step()) all.push_back(entryAt(s));
    return all;
}

std::vector<CXJournalEntry> Journal::foreignEntries(int64_t after, int64_t until, const std::string& program) {
    auto s = _database.statement("SELECT j.seq, j.uid, j.change, s.pid, s.program, s.date FROM journal j "
                                 "JOIN saves s ON s.id=j.save WHERE j.seq>? AND j.seq<=? AND s.program<>? "
                                 "ORDER BY j.seq");
    s.bind(1, after).bind(2, until).bind(3, program);
    std::vector<CXJournalEntry> all;
    while (s.step()) all.push_back(entryAt(s));
    return all;
}

bool Journal::hasForeignEntries(int64_t after, const std::string& program) {
    auto s = _database.statement("SELECT 1 FROM journal j JOIN saves s ON s.id=j.save "
                                 "WHERE j.seq>? AND s.program<>? LIMIT 1");
    return s.bind(1, after).bind(2, program).step();
}

std::optional<int64_t> Journal::firstForeignNotAfter(int64_t after, int64_t until, const std::string& program,
                                                     Date date) {
    auto s = _database.statement("SELECT j.seq FROM journal j JOIN saves s ON s.id=j.save "
                                 "WHERE j.seq>? AND j.seq<=? AND s.program<>? AND s.date<=? ORDER BY j.seq LIMIT 1");
    if (!s.bind(1, after).bind(2, until).bind(3, program).bind(4, date.secondsSince1970()).step()) return std::nullopt;
    return s.integer(0);
}

std::optional<int64_t> Journal::cursor(const std::string& program) {
    auto s = _database.statement("SELECT seq FROM cursors WHERE program=?");
    if (!s.bind(1, program).step()) return std::nullopt;
    return s.integer(0);
}

void Journal::setCursor(const std::string& program, int64_t sequence) {
    auto s = _database.statement("INSERT INTO cursors VALUES(?1, ?2) "
                                 "ON CONFLICT(program) DO UPDATE SET seq=max(seq, ?2)");
    s.bind(1, program).bind(2, sequence).run();
}

std::string Journal::latestToken() {
    auto s = _database.statement("SELECT token FROM saves ORDER BY id DESC LIMIT 1");
    return s.step() ? s.text(0) : "";
}

bool Journal::hasToken(const std::string& token) {
    return _database.statement("SELECT 1 FROM saves WHERE token=?").bind(1, token).step();
}

int64_t Journal::beginSave(int64_t processID, const std::string& program, Date date) {
    auto s = _database.statement("INSERT INTO saves(pid, program, date, token) VALUES(?,?,?,hex(randomblob(16)))");
    s.bind(1, processID).bind(2, program).bind(3, date.secondsSince1970()).run();
    return _database.lastInsertId();
}

void Journal::note(int64_t save, const UniqueId& uid, CXChangeKind kind) {
    auto s = _database.statement("INSERT INTO journal(save, uid, change) VALUES(?,?,?)");
    s.bind(1, save).bind(2, uid.str()).bind(3, static_cast<int>(kind)).run();
}

void Journal::prune() {
    // Without any cursor nobody reads the journal: who comes later starts with a full scan. So does the server of the
    // address books when it has not been asked for long.
    int64_t passed = 0;
    {
        auto s = _database.statement(
            "SELECT coalesce((SELECT min(CASE program WHEN ?1 THEN max(seq, (SELECT max(seq) FROM journal) - ?2) "
            "ELSE seq END) FROM cursors), (SELECT max(seq) - 1000 FROM journal), 0)");
        if (s.bind(1, kCXBooksProgram).bind(2, kBooksMayLag).step()) passed = s.integer(0);
    }
    passed = std::min(passed, position() - kEntriesKept);
    _database.statement("DELETE FROM journal WHERE seq<=?").bind(1, passed).run();
    int64_t needed = _database.integer("SELECT coalesce((SELECT save FROM journal ORDER BY seq LIMIT 1), 1 << 62)");
    auto s = _database.statement("DELETE FROM saves WHERE id<? AND id<=(SELECT max(id) FROM saves)-?");
    s.bind(1, needed).bind(2, kSavesKept).run();
}

Dictionary joinedChanges(const std::vector<CXJournalEntry>& entries, int64_t ownProcessID) {
    std::map<UniqueId, NetChange> net;
    std::vector<UniqueId> order;
    for (const CXJournalEntry& e : entries) {
        auto [at, made] = net.try_emplace(e.uniqueId);
        if (made) order.push_back(e.uniqueId);
        at->second.inserted |= e.kind == CXChangeKind::inserted;
        at->second.last = e.kind;
    }
    Array inserted, updated, deleted;
    for (const UniqueId& uid : order) {
        if (net.contains(groupOfContents(uid))) continue;
        const NetChange& change = net.at(uid);
        if (change.last == CXChangeKind::deleted)
            deleted.append(uid);
        else
            (change.inserted ? inserted : updated).append(uid);
    }
    Dictionary info;
    if (!inserted.empty()) info.set(kCXInsertedRecords, inserted);
    if (!updated.empty()) info.set(kCXUpdatedRecords, updated);
    if (!deleted.empty()) info.set(kCXDeletedRecords, deleted);
    int64_t sender = entries.empty() ? 0 : entries.back().processID;
    info.set(kCXSenderProcessID, sender == ownProcessID ? int64_t{0} : sender);
    return info;
}

} // namespace rolvane
