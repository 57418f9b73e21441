#include "contacts/database/FormerVersions.h"

#include <limits>

namespace rolvane {

void FormerVersions::begin() {
    if (!areKept()) _database.execute(kTable);
}

bool FormerVersions::areKept() {
    return _database.integer("SELECT count(*) FROM sqlite_master WHERE type='table' AND name='former'") != 0;
}

// A version that has that very date is the one. Else it is the one whose time it was, unless the clock has been set
// back between two edits: then moments name no version.
std::shared_ptr<const Bytes> FormerVersions::of(const UniqueId& uid, Date at) {
    if (!areKept()) return nullptr;
    auto s = _database.statement("SELECT modified, replaced, id FROM former WHERE uid=? ORDER BY id");
    s.bind(1, uid.str());
    const double moment = at.secondsSince1970();
    int64_t exact = 0, around = 0;
    bool isSetBack = false;
    for (double last = -std::numeric_limits<double>::infinity(); s.step(); last = s.real(1)) {
        isSetBack |= s.real(0) > s.real(1) || s.real(1) < last;
        if (s.real(0) == moment) exact = s.integer(2);
        if (s.real(0) <= moment && moment < s.real(1)) around = s.integer(2);
    }
    const int64_t found = exact != 0 ? exact : isSetBack ? 0 : around;
    if (found == 0) return nullptr;
    auto properties = _database.statement("SELECT properties FROM former WHERE id=?");
    properties.bind(1, found).step();
    return std::make_shared<const Bytes>(properties.bytes(0));
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
