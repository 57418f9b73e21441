// The part of RecordStore that wants an open transaction.

#include "contacts/database/RecordStore.h"

#include "foundation/PropertyList.h"

namespace rolvane {

void RecordStore::insertRow(const UniqueId& uid, RecordKind kind, const Dictionary& properties, const Bytes& encoded,
                            Date created, const std::string& writer) {
    DerivedColumns columns = deriveColumns(kind, properties);
    auto s = _database.statement("INSERT INTO records(uid, kind, location, created, modified, display, sort, search, "
                                 "properties, writer) VALUES(?,?,?,?,?,?,?,?,?,?)");
    s.bind(1, uid.str()).bind(2, static_cast<int>(kind)).bind(3, columns.location);
    s.bind(4, created.secondsSince1970()).bind(5, created.secondsSince1970());
    s.bind(6, columns.display).bind(7, columns.sort).bind(8, columns.search).bind(9, encoded);
    s.bind(10, std::string_view(writer)).run();
}

void RecordStore::updateRow(int64_t id, RecordKind kind, const Dictionary& properties, const Bytes& encoded,
                            Date modified, const std::string& writer) {
    DerivedColumns columns = deriveColumns(kind, properties);
    auto s =
        _database.statement("UPDATE records SET kind=?2, location=?3, modified=?4, display=?5, sort=?6, search=?7, "
                            "properties=?8, writer=?9 WHERE id=?1");
    s.bind(1, id).bind(2, static_cast<int>(kind)).bind(3, columns.location).bind(4, modified.secondsSince1970());
    s.bind(5, columns.display).bind(6, columns.sort).bind(7, columns.search).bind(8, encoded);
    s.bind(9, std::string_view(writer)).run();
}

void RecordStore::removeRow(int64_t id) {
    _database.statement("DELETE FROM records WHERE id=?").bind(1, id).run();
}

void RecordStore::setModified(int64_t id, Date modified) {
    auto s = _database.statement("UPDATE records SET modified=?2 WHERE id=?1");
    s.bind(1, id).bind(2, modified.secondsSince1970()).run();
}

void RecordStore::touchParents(int64_t member, Date modified) {
    auto s = _database.statement("UPDATE records SET modified=?2 WHERE id IN "
                                 "(SELECT group_id FROM listed WHERE member_id=?1)");
    s.bind(1, member).bind(2, modified.secondsSince1970()).run();
}

bool RecordStore::addListed(int64_t group, int64_t member) {
    auto s =
        _database.statement("INSERT OR IGNORE INTO listed(group_id, position, member_id) "
                            "VALUES(?1, (SELECT coalesce(max(position), 0) + 1 FROM listed WHERE group_id=?1), ?2)");
    s.bind(1, group).bind(2, member).run();
    return _database.changes() > 0;
}

bool RecordStore::removeListed(int64_t group, int64_t member) {
    auto s = _database.statement("DELETE FROM listed WHERE member_id=?2 AND group_id=?1");
    s.bind(1, group).bind(2, member).run();
    return _database.changes() > 0;
}

bool RecordStore::isReachable(int64_t from, int64_t to) {
    auto s = _database.statement("WITH RECURSIVE below(id) AS (SELECT ?1 UNION "
                                 "SELECT l.member_id FROM listed l JOIN below b ON l.group_id=b.id "
                                 "JOIN records r ON r.id=l.member_id WHERE r.kind IN (3,4)) "
                                 "SELECT 1 FROM below WHERE id=?2");
    return s.bind(1, from).bind(2, to).step();
}

bool RecordStore::setChoice(int64_t group, int64_t person, const std::string& property, const std::string& identifier) {
    auto s =
        _database.statement("INSERT INTO choices VALUES(?1, ?2, ?3, ?4) ON CONFLICT(group_id, person_id, property) "
                            "DO UPDATE SET identifier=?4 WHERE identifier<>?4");
    s.bind(1, group).bind(2, person).bind(3, property).bind(4, identifier).run();
    return _database.changes() > 0;
}

bool RecordStore::removeChoice(int64_t group, int64_t person, const std::string& property) {
    auto s = _database.statement("DELETE FROM choices WHERE group_id=? AND person_id=? AND property=?");
    s.bind(1, group).bind(2, person).bind(3, property).run();
    return _database.changes() > 0;
}

bool RecordStore::removeChoices(int64_t group, int64_t person) {
    auto s = _database.statement("DELETE FROM choices WHERE group_id=? AND person_id=?");
    s.bind(1, group).bind(2, person).run();
    return _database.changes() > 0;
}

} // namespace rolvane
