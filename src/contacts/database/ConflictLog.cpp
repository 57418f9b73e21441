#include "contacts/database/ConflictLog.h"

#include "foundation/PropertyList.h"

namespace rolvane {

std::vector<CXConflict> ConflictLog::selected(std::string_view condition, int64_t number) {
    auto s = _database.statement("SELECT id, uid, name, date, property, kept, lost, winner FROM conflicts " +
                                 std::string(condition) + " ORDER BY id");
    if (!condition.empty()) s.bind(1, number);
    std::vector<CXConflict> all;
    while (s.step()) {
        CXConflict each;
        each.number = s.integer(0);
        each.uniqueId = UniqueId(s.text(1));
        each.name = s.text(2);
        each.date = Date(s.real(3));
        each.merge = {s.text(4), BinaryValue::decode(s.bytes(5)).dictionary(),
                      BinaryValue::decode(s.bytes(6)).dictionary(), s.integer(7) == 0 ? CXSide::ours : CXSide::theirs};
        all.push_back(std::move(each));
    }
    return all;
}

std::vector<CXConflict> ConflictLog::all() {
    return selected("", 0);
}

std::optional<CXConflict> ConflictLog::find(int64_t number) {
    auto found = selected("WHERE id=?", number);
    return found.empty() ? std::nullopt : std::optional(std::move(found.front()));
}

void ConflictLog::note(const CXConflict& conflict) {
    const Bytes kept = BinaryValue::encode(conflict.merge.kept), lost = BinaryValue::encode(conflict.merge.lost);
    auto known = _database.statement("SELECT 1 FROM conflicts WHERE uid=? AND property=? AND kept=? AND lost=?");
    known.bind(1, conflict.uniqueId.str()).bind(2, std::string_view(conflict.merge.property)).bind(3, kept);
    if (known.bind(4, lost).step()) return;
    auto s = _database.statement("INSERT INTO conflicts(uid, name, date, property, kept, lost, winner) "
                                 "VALUES(?,?,?,?,?,?,?)");
    s.bind(1, conflict.uniqueId.str()).bind(2, std::string_view(conflict.name));
    s.bind(3, conflict.date.secondsSince1970()).bind(4, std::string_view(conflict.merge.property));
    s.bind(5, kept).bind(6, lost).bind(7, conflict.merge.winner == CXSide::ours ? 0 : 1).run();
    auto old = _database.statement("DELETE FROM conflicts WHERE id<=(SELECT max(id) FROM conflicts)-?");
    old.bind(1, static_cast<int64_t>(kKept)).run();
}

bool ConflictLog::forget(int64_t number) {
    _database.statement("DELETE FROM conflicts WHERE id=?").bind(1, number).run();
    return _database.changes() > 0;
}

} // namespace rolvane
