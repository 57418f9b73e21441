#include "contacts/database/ChangeLog.h"

#include "contacts/records/Identifier.h"

namespace rolvane {

namespace {

constexpr int64_t kBytesOfADetail = 100; // besides what was before: row, identifiers and indexes, about

constexpr std::string_view kChangeColumns = "SELECT id, date, program, command, undone FROM changes ";
constexpr std::string_view kDetailColumns = "SELECT id, change, uid, kind, other, before FROM details ";

} // namespace

CXLoggedChange ChangeLog::read(Sqlite::Statement& row) {
    CXLoggedChange change;
    change.number = row.integer(0);
    change.date = Date(row.real(1));
    change.program = row.text(2);
    change.command = row.text(3);
    change.isUndone = row.integer(4) != 0;
    auto count = _database.statement("SELECT count(DISTINCT uid) FROM details WHERE change=? AND kind<=3 AND "
                                     "(uid LIKE '%:CXGroup' OR uid LIKE '%:CXSubscribedGroup')=?");
    for (const bool groups : {false, true}) {
        count.bind(1, change.number).bind(2, groups ? 1 : 0).step();
        (groups ? change.groups : change.people) = static_cast<size_t>(count.integer(0));
        count.reset();
    }
    return change;
}

std::vector<CXLoggedChange> ChangeLog::latest(size_t limit, const std::optional<UniqueId>& of) {
    auto s = _database.statement(std::string(kChangeColumns) +
                                 (of ? "WHERE id IN (SELECT change FROM details WHERE uid=?2 OR other=?2) " : "") +
                                 "ORDER BY id DESC LIMIT ?1");
    s.bind(1, static_cast<int64_t>(limit));
    if (of) s.bind(2, of->str());
    std::vector<CXLoggedChange> all;
    while (s.step()) all.push_back(read(s));
    return all;
}

std::optional<CXLoggedChange> ChangeLog::find(int64_t change) {
    auto s = _database.statement(std::string(kChangeColumns) + "WHERE id=?");
    return s.bind(1, change).step() ? std::optional(read(s)) : std::nullopt;
}

std::vector<CXChangeDetail> ChangeLog::selected(std::string_view condition, int64_t number, const UniqueId& uid) {
    auto s = _database.statement(std::string(kDetailColumns) + std::string(condition));
    if (condition.find("?1") != std::string_view::npos) s.bind(1, number);
    if (condition.find("?2") != std::string_view::npos) s.bind(2, uid.str());
    std::vector<CXChangeDetail> all;
    while (s.step()) {
        CXChangeDetail each;
        each.number = s.integer(0);
        each.change = s.integer(1);
        each.uniqueId = UniqueId(s.text(2));
        each.kind = static_cast<CXDetailKind>(s.integer(3));
        if (!s.isNull(4)) each.group = UniqueId(s.text(4));
        if (!s.isNull(5)) each.before = std::make_shared<const Bytes>(s.bytes(5));
        all.push_back(std::move(each));
    }
    return all;
}

std::vector<CXChangeDetail> ChangeLog::details(int64_t change, const std::optional<UniqueId>& of) {
    return of ? selected("WHERE change=?1 AND (uid=?2 OR other=?2) ORDER BY id", change, *of)
              : selected("WHERE change=?1 ORDER BY id", change, {});
}

std::optional<CXChangeDetail> ChangeLog::next(const CXChangeDetail& detail) {
    auto found =
        selected("WHERE uid=?2 AND id>?1 AND kind IN (2,3) ORDER BY id LIMIT 1", detail.number, detail.uniqueId);
    return found.empty() ? std::nullopt : std::optional(std::move(found.front()));
}

bool ChangeLog::isTouchedAfter(const CXChangeDetail& detail) {
    auto s = _database.statement("SELECT 1 FROM details WHERE uid=? AND id>? AND change<>? AND kind<=3 LIMIT 1");
    return s.bind(1, detail.uniqueId.str()).bind(2, detail.number).bind(3, detail.change).step();
}

std::vector<CXChangeDetail> ChangeLog::deleted() {
    return selected("WHERE kind=3 ORDER BY id DESC", 0, {});
}

std::optional<int64_t> ChangeLog::lastUntil(Date moment) {
    auto setBack =
        _database.statement("SELECT 1 FROM (SELECT date, lag(date) OVER (ORDER BY id) AS former FROM changes) "
                            "WHERE former>date AND former>=?1 LIMIT 1");
    if (setBack.bind(1, moment.secondsSince1970()).step()) return std::nullopt;
    auto s = _database.statement("SELECT max(id) FROM changes WHERE date<=?1");
    s.bind(1, moment.secondsSince1970()).step();
    return s.isNull(0) ? std::nullopt : std::optional(s.integer(0));
}

std::optional<CXDetailKind> ChangeLog::firstMoveBehind(int64_t change, const UniqueId& group, const UniqueId& member) {
    auto s = _database.statement("SELECT kind FROM details WHERE uid=?1 AND other=?2 AND kind IN (4,5) AND change>?3 "
                                 "ORDER BY id LIMIT 1");
    s.bind(1, member.str()).bind(2, group.str()).bind(3, change);
    return s.step() ? std::optional(static_cast<CXDetailKind>(s.integer(0))) : std::nullopt;
}

void ChangeLog::begin(const std::string& program, Date date) {
    _program = program;
    _date = date;
    _bytes = 0;
    _current = 0;
}

void ChangeLog::note(const UniqueId& uid, CXDetailKind kind, const UniqueId& group, const Bytes* before) {
    if (_current == 0 && _open != 0 && find(_open)) _current = _open;
    if (_current == 0) {
        auto s = _database.statement("INSERT INTO changes(date, program, command, bytes, total) VALUES(?,?,?,0,0)");
        s.bind(1, _date.secondsSince1970()).bind(2, std::string_view(_program)).bind(3, std::string_view(_command));
        s.run();
        _current = _database.lastInsertId();
    }
    auto s = _database.statement("INSERT INTO details(change, uid, kind, other, before) VALUES(?,?,?,nullif(?,''),?)");
    s.bind(1, _current).bind(2, uid.str()).bind(3, static_cast<int>(kind)).bind(4, std::string_view(group.str()));
    if (before) s.bind(5, *before);
    s.run();
    _bytes += kBytesOfADetail + static_cast<int64_t>(before ? before->size() : 0);
}

void ChangeLog::finish() {
    if (_current == 0) return;
    // `total` of a change is that of all changes up to it, those that have left included.
    _database.statement("UPDATE changes SET bytes=bytes+?2, total=(SELECT max(total) FROM changes)+?2 WHERE id=?1")
        .bind(1, _current)
        .bind(2, _bytes)
        .run();
    prune();
}

void ChangeLog::prune() {
    const int64_t total = _database.integer("SELECT max(total) FROM changes");
    auto oldest = _database.statement("SELECT id, date, bytes, total FROM changes ORDER BY id LIMIT 1");
    while (oldest.step()) {
        const int64_t id = oldest.integer(0);
        const bool isOld = oldest.real(1) < _date.secondsSince1970() - kSecondsKept;
        const bool isTooMuch = oldest.integer(2) + total - oldest.integer(3) > _bytesKept;
        oldest.reset();
        if (!isOld && !isTooMuch) return;
        _database.statement("DELETE FROM details WHERE change=?").bind(1, id).run();
        _database.statement("DELETE FROM changes WHERE id=?").bind(1, id).run();
    }
}

void ChangeLog::setUndone(int64_t change) {
    _database.statement("UPDATE changes SET undone=1 WHERE id=?").bind(1, change).run();
}

void ChangeLog::forget(const UniqueId& uid) {
    _database.statement("DELETE FROM details WHERE uid=?1 OR other=?1").bind(1, uid.str()).run();
}

} // namespace rolvane
