#include "contacts/database/CommonVersions.h"

namespace rolvane {

std::optional<CXCommonVersion> CommonVersions::of(const UniqueId& uid) {
    auto s = _database.statement(
        "SELECT c.properties, c.edited FROM common c WHERE c.record_id=(SELECT id FROM records WHERE uid=?)");
    if (!s.bind(1, uid.str()).step()) return std::nullopt;
    CXCommonVersion version;
    if (!s.isNull(0)) version.properties = std::make_shared<const Bytes>(s.bytes(0));
    if (!s.isNull(1)) version.edited = Date(s.real(1));
    if (!version.properties || !hasSentTable()) return version;
    auto sent = _database.statement(std::string("SELECT properties, ") + (datesSent() ? "edited" : "NULL") +
                                    " FROM sent WHERE record_id=(SELECT id FROM records WHERE uid=?) ORDER BY rowid");
    sent.bind(1, uid.str());
    while (sent.step())
        version.sent.push_back({std::make_shared<const Bytes>(sent.bytes(0)),
                                sent.isNull(1) ? std::nullopt : std::optional(Date(sent.real(1)))});
    return version;
}

bool CommonVersions::hasSentTable() {
    return _database.statement("SELECT 1 FROM sqlite_master WHERE type='table' AND name='sent'").step();
}

bool CommonVersions::datesSent() {
    return _database.statement("SELECT 1 FROM pragma_table_info('sent') WHERE name='edited'").step();
}

std::vector<UniqueId> CommonVersions::edited() {
    auto s = _database.statement("SELECT r.uid FROM common c CROSS JOIN records r ON r.id=c.record_id "
                                 "WHERE c.properties IS NOT NULL ORDER BY c.record_id");
    std::vector<UniqueId> all;
    while (s.step()) all.emplace_back(s.textView(0));
    return all;
}

void CommonVersions::keep(int64_t record, const Bytes& before, Date when) {
    auto s = _database.statement("UPDATE common SET properties=coalesce(properties, ?2), edited=?3 WHERE record_id=?1");
    s.bind(1, record).bind(2, before).bind(3, when.secondsSince1970()).run();
}

void CommonVersions::set(const UniqueId& uid, const Bytes& properties) {
    auto s = _database.statement(
        "INSERT INTO common SELECT id, CASE WHEN properties=?2 THEN NULL ELSE ?2 END, "
        "CASE WHEN properties=?2 THEN NULL ELSE modified END FROM records WHERE uid=?1 "
        "ON CONFLICT(record_id) DO UPDATE SET properties=excluded.properties, "
        "edited=CASE WHEN excluded.properties IS NULL THEN NULL ELSE coalesce(edited, excluded.edited) END");
    s.bind(1, uid.str()).bind(2, properties).run();
    if (!hasSentTable()) return;
    _database.statement("DELETE FROM sent WHERE record_id=(SELECT id FROM records WHERE uid=?)")
        .bind(1, uid.str())
        .run();
}

void CommonVersions::addSent(const UniqueId& uid, const Bytes& properties) {
    if (!hasSentTable())
        _database.execute(kSentTable);
    else if (!datesSent())
        _database.execute("ALTER TABLE sent ADD COLUMN edited REAL");
    _database
        .statement("INSERT OR IGNORE INTO sent(record_id, properties, edited) "
                   "SELECT r.id, ?2, c.edited FROM records r LEFT JOIN common c ON c.record_id=r.id WHERE r.uid=?1")
        .bind(1, uid.str())
        .bind(2, properties)
        .run();
}

} // namespace rolvane
