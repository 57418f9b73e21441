// The part of RecordStore that does not believe the indexes.

#include "contacts/database/DamagedDatabase.h"
#include "contacts/database/RecordStore.h"

#include <unordered_set>

namespace rolvane {

void RecordStore::forEachRowOfTable(const std::function<void(const TableRow&)>& call, bool withProperties) {
    auto s = _database.statement(withProperties ? "SELECT id, uid, kind, location, properties FROM records NOT INDEXED"
                                                : "SELECT id, uid, kind, location FROM records NOT INDEXED");
    while (s.step())
        call({s.integer(0), s.text(1), static_cast<RecordKind>(s.integer(2)), s.text(3),
              withProperties ? s.bytes(4) : Bytes()});
}

void RecordStore::forEachOfIndex(Index index, const std::function<void(int64_t, std::string)>& call) {
    const auto sql = [&] {
        switch (index) {
        case Index::names: return "SELECT id, uid FROM records INDEXED BY records_names";
        case Index::locations: return "SELECT id, uid FROM records INDEXED BY records_location";
        case Index::identifiers: break;
        }
        return "SELECT id, uid FROM records INDEXED BY sqlite_autoindex_records_1";
    };
    auto s = _database.statement(sql());
    while (s.step()) call(s.integer(0), s.text(1));
}

std::set<std::pair<int64_t, int64_t>> RecordStore::listsOfTable() {
    std::set<std::pair<int64_t, int64_t>> pairs;
    auto s = _database.statement("SELECT group_id, member_id FROM listed NOT INDEXED ORDER BY group_id, position");
    while (s.step()) pairs.emplace(s.integer(0), s.integer(1));
    return pairs;
}

RecordStore::ListsOfIndex RecordStore::listsOfIndex() {
    ListsOfIndex all;
    try {
        auto s = _database.statement("SELECT group_id, member_id FROM listed INDEXED BY listed_member");
        std::pair<int64_t, int64_t> last{INT64_MIN, INT64_MIN};
        while (s.step()) {
            const std::pair<int64_t, int64_t> now{s.integer(1), s.integer(0)};
            all.isInOrder = all.isInOrder && last < now;
            last = now;
            all.pairs.emplace(s.integer(0), s.integer(1));
        }
    } catch (const CXDamagedDatabase&) {
        all.isReadable = false;
    }
    return all;
}

std::optional<UniqueId> RecordStore::firstListedAfterAll(const UniqueId& group, const std::vector<UniqueId>& members) {
    // The number is of an index, too.
    auto row = _database.statement("SELECT uid FROM records NOT INDEXED WHERE id=?");
    const auto isOf = [&](int64_t number, const UniqueId& uid) {
        row.reset();
        return row.bind(1, number).step() && row.textView(0) == uid.str();
    };
    const int64_t number = rowNumber(group);
    if (!isOf(number, group)) return group;
    std::unordered_set<int64_t> listed;
    auto s = _database.statement("SELECT member_id FROM listed NOT INDEXED WHERE group_id=?");
    s.bind(1, number);
    while (s.step()) listed.insert(s.integer(0));
    auto byIndex =
        _database.statement("SELECT 1 FROM listed INDEXED BY listed_member WHERE member_id=? AND group_id=?");
    for (const UniqueId& uid : members) {
        const int64_t member = rowNumber(uid);
        if (member == 0) continue;
        byIndex.reset();
        if (!isOf(member, uid) || listed.contains(member) || byIndex.bind(1, member).bind(2, number).step()) return uid;
    }
    return std::nullopt;
}

std::string RecordStore::whatIsWrong() {
    constexpr int kTold = 3;
    std::string wrong;
    auto s = _database.statement("PRAGMA integrity_check(10)");
    for (int line = 0; s.step() && line < kTold; ++line)
        if (const std::string text = s.text(0); text != "ok") wrong += (wrong.empty() ? "" : "; ") + text;
    auto dangling = _database.statement("PRAGMA foreign_key_check");
    if (wrong.empty() && dangling.step()) wrong = "a list names what is not there";
    return wrong;
}

} // namespace rolvane
