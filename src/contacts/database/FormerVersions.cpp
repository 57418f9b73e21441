#include "contacts/database/FormerVersions.h"

namespace rolvane {

void FormerVersions::begin() {
    if (!areKept()) _database.execute(kTable);
}

bool FormerVersions::areKept() {
    return _database.integer("SELECT count(*) FROM sqlite_master WHERE type='table' AND name='former'") != 0;
}

std::shared_ptr<const Bytes> FormerVersions::of(const UniqueId& uid, Date at) {
    if (!areKept()) return nullptr;
    auto s = _database.statement(
        "SELECT modified, properties FROM former WHERE uid=? AND replaced>? ORDER BY replaced, id LIMIT 1");
    if (!s.bind(1, uid.str()).bind(2, at.secondsSince1970()).step()) return nullptr;
    if (s.real(0) > at.secondsSince1970()) return nullptr; // what was then is forgotten
    return std::make_shared<const Bytes>(s.bytes(1));
}

void FormerVersions::keep(const UniqueId& uid, Date modified, Date replaced, const Bytes& properties) {
    auto s = _database.statement("INSERT INTO former(uid, modified, replaced, properties) VALUES(?,?,?,?)");
    s.bind(1, uid.str()).bind(2, modified.secondsSince1970()).bind(3, replaced.secondsSince1970());
    s.bind(4, properties).run();
}

void FormerVersions::prune() {
    _database.statement("DELETE FROM former WHERE id<=(SELECT max(id) FROM former)-?").bind(1, kKept).run();
}

} // namespace rolvane
