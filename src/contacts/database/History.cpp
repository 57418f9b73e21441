#include "contacts/database/History.h"

#include "contacts/database/RolvaneImpl.h"
#include "contacts/records/SharingDates.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <set>

namespace rolvane {

namespace {

// Publishing and sharing have commands of their own; a location belongs to the copy.
bool isOfSharing(std::string_view property) {
    for (const char* each : {kCXRemoteLocationProperty, kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty,
                             kCXReadSharingDatesProperty, kCXReadWriteSharingDatesProperty})
        if (property == each) return true;
    return false;
}

Dictionary decoded(const std::shared_ptr<const Bytes>& properties) {
    return properties ? BinaryValue::decode(*properties).dictionary() : Dictionary();
}

bool isGroupId(const UniqueId& uid) {
    return uid.str().ends_with(":" + std::string(kCXGroupTable)) ||
           uid.str().ends_with(":" + std::string(kCXSubscribedGroupTable));
}

std::string nameIn(const UniqueId& uid, const Dictionary& properties) {
    return isGroupId(uid) ? properties[kCXGroupNameProperty].string() : cxDisplayName(properties);
}

} // namespace

void CXHistory::savesAreOne(const std::string& command) {
    std::lock_guard lock(_rolvane.impl().mutex);
    _rolvane.impl().changeLog.savesAreOne(command);
}

std::vector<CXLoggedChange> CXHistory::latest(size_t limit, const std::optional<UniqueId>& of) {
    std::lock_guard lock(_rolvane.impl().mutex);
    return _rolvane.impl().changeLog.latest(limit, of);
}

std::optional<CXLoggedChange> CXHistory::change(int64_t number) {
    std::lock_guard lock(_rolvane.impl().mutex);
    return _rolvane.impl().changeLog.find(number);
}

std::vector<CXChangeDetail> CXHistory::details(int64_t change, const std::optional<UniqueId>& of) {
    std::lock_guard lock(_rolvane.impl().mutex);
    return _rolvane.impl().changeLog.details(change, of);
}

std::optional<int64_t> CXHistory::lastUntil(Date moment) {
    std::lock_guard lock(_rolvane.impl().mutex);
    return _rolvane.impl().changeLog.lastUntil(moment);
}

bool CXHistory::wasListed(int64_t change, const UniqueId& group, const UniqueId& member, bool isNow) {
    std::lock_guard lock(_rolvane.impl().mutex);
    const auto move = _rolvane.impl().changeLog.firstMoveBehind(change, group, member);
    return move ? *move == CXDetailKind::left : isNow;
}

Dictionary CXHistory::after(const CXChangeDetail& detail) {
    std::lock_guard lock(_rolvane.impl().mutex);
    if (detail.kind == CXDetailKind::deleted) return {};
    if (const auto next = _rolvane.impl().changeLog.next(detail)) return decoded(next->before);
    const std::optional<StoredRow> row = _rolvane.impl().store.row(detail.uniqueId);
    return row ? decoded(row->properties) : Dictionary();
}

std::string CXHistory::nameOf(const CXChangeDetail& detail) {
    if (detail.before && detail.kind != CXDetailKind::chosen) return nameIn(detail.uniqueId, decoded(detail.before));
    const Dictionary now = after(detail);
    return now.empty() ? detail.uniqueId.str() : nameIn(detail.uniqueId, now);
}

std::vector<UniqueId> CXHistory::deletedNamed(const std::string& name) {
    std::vector<CXChangeDetail> all;
    {
        std::lock_guard lock(_rolvane.impl().mutex);
        all = _rolvane.impl().changeLog.deleted();
    }
    std::vector<UniqueId> found;
    for (const CXChangeDetail& each : all)
        if ((each.uniqueId.str() == name || nameIn(each.uniqueId, decoded(each.before)) == name) &&
            std::find(found.begin(), found.end(), each.uniqueId) == found.end())
            found.push_back(each.uniqueId);
    return found;
}

// From the last detail to the first, so that whatever a detail found is there again when its turn comes.
class CXHistory::Undoing {
public:
    Undoing(CXHistory& history, CXRolvane& rolvane) : _history(history), _rolvane(rolvane) {}

    CXUndone undo(int64_t change) {
        std::vector<CXChangeDetail> details = _history.details(change);
        std::reverse(details.begin(), details.end());
        for (const CXChangeDetail& detail : details) switch (detail.kind) {
            case CXDetailKind::added: remove(detail); break;
            case CXDetailKind::changed: changeBack(detail); break;
            case CXDetailKind::deleted: bringBack(detail); break;
            case CXDetailKind::joined:
            case CXDetailKind::left: move(detail, detail.kind == CXDetailKind::left); break;
            case CXDetailKind::chosen: choose(detail); break;
            }
        return std::move(_undone);
    }

private:
    void leave(const CXChangeDetail& detail, const std::string& why) {
        _undone.left.push_back(_history.nameOf(detail) + " " + why);
    }

    bool mayBeChanged(const CXRecord& record, const CXChangeDetail& detail) {
        if (record.isWritable()) return true;
        leave(detail, "stays as it is: it is a copy that you may read only.");
        return false;
    }

    bool isTouchedAfter(const CXChangeDetail& detail) {
        std::lock_guard lock(_rolvane.impl().mutex);
        return _rolvane.impl().changeLog.isTouchedAfter(detail);
    }

    // Each change since then has been taken back, too.
    bool isAsAdded(const CXChangeDetail& detail) {
        std::lock_guard lock(_rolvane.impl().mutex);
        const auto next = _rolvane.impl().changeLog.next(detail);
        const std::optional<StoredRow> row = _rolvane.impl().store.row(detail.uniqueId);
        return next && row && decoded(next->before) == decoded(row->properties);
    }

    void remove(const CXChangeDetail& detail) {
        const CXRecordRef record = _rolvane.recordForUniqueId(detail.uniqueId);
        if (!record || !mayBeChanged(*record, detail)) return;
        if (isTouchedAfter(detail) && !isAsAdded(detail)) return leave(detail, "stays: it was changed since.");
        if (record->valueForProperty(kCXRemoteLocationProperty) && !record->isSubscribed())
            return leave(detail, "stays: it is published. `rolvane unpublish --group` comes first.");
        _undone.removed += _rolvane.removeRecord(record);
    }

    void changeBack(const CXChangeDetail& detail) {
        const CXRecordRef record = _rolvane.recordForUniqueId(detail.uniqueId);
        if (!record) return leave(detail, "is gone since.");
        const Dictionary before = decoded(detail.before), after = _history.after(detail);
        std::set<std::string> names;
        for (const Dictionary& each : {before, after})
            for (const auto& [property, value] : each)
                if (!isOfSharing(property) && before[property] != after[property]) names.insert(property);
        if (names.empty() || !mayBeChanged(*record, detail)) return;
        bool changed = false;
        for (const std::string& property : names) {
            if (record->valueForProperty(property) != after[property]) {
                leave(detail, "keeps its " + property + ": that was changed again since.");
                continue;
            }
            changed |= before[property] ? record->setValue(before[property], property)
                                        : record->removeValueForProperty(property);
        }
        _undone.changed += changed;
    }

    // A copy comes back as one where its publisher takes it, else as the owner's own.
    void bringBack(const CXChangeDetail& detail) {
        if (_rolvane.recordForUniqueId(detail.uniqueId)) return leave(detail, "is there already.");
        Dictionary properties = decoded(detail.before).mutableCopy();
        const bool isCopy = cxIsSubscribed(detail.uniqueId);
        const bool isGroup = isGroupId(detail.uniqueId);
        const RemoteLocation location(
            isCopy ? locationOf(isGroup ? RecordKind::subscribedGroup : RecordKind::subscribedPerson, properties)
                   : std::string());
        const CXSubscriptionRef subscription = isCopy ? _rolvane.findSubscriptionWithRemoteLocation(location) : nullptr;
        const bool staysCopy = subscription && subscription->isWritable();
        if (!staysCopy)
            for (const char* each :
                 {kCXRemoteLocationProperty, kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
                properties.remove(each);
        CXRecordRef record;
        if (isCopy && !staysCopy)
            record = isGroup ? CXRecordRef(CXGroup::create()) : CXRecordRef(CXPerson::create());
        else
            record = isGroup ? CXRecordRef(CXGroup::initWithUniqueId(detail.uniqueId))
                             : CXRecordRef(CXPerson::initWithUniqueId(detail.uniqueId));
        record->resetWithDictionary(properties, false, false);
        _rolvane.addRecord(record);
        _instead[detail.uniqueId] = record->uniqueId();
        _undone.broughtBack++;
        _undone.asOwn += isCopy && !staysCopy;
    }

    CXRecordRef present(const UniqueId& uid) {
        const auto other = _instead.find(uid);
        return _rolvane.recordForUniqueId(other == _instead.end() ? uid : other->second);
    }

    void move(const CXChangeDetail& detail, bool in) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(present(detail.group));
        const CXRecordRef member = present(detail.uniqueId);
        if (!group || !member || !group->isWritable()) return;
        if (const auto person = std::dynamic_pointer_cast<CXPerson>(member))
            _undone.memberships += in ? group->addMember(person) : group->removeMember(person);
        else if (const auto below = std::dynamic_pointer_cast<CXGroup>(member); below && !in)
            _undone.memberships += group->removeSubgroup(below);
        else if (below && group->mayListSubgroup(below))
            _undone.memberships += group->addSubgroup(below);
    }

    void choose(const CXChangeDetail& detail) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(present(detail.group));
        const auto person = std::dynamic_pointer_cast<CXPerson>(present(detail.uniqueId));
        if (!group || !person || !group->isWritable()) return;
        const Dictionary before = decoded(detail.before);
        const std::string identifier = before["identifier"].string();
        group->setDistributionIdentifier(identifier.empty() ? std::nullopt : std::optional(identifier),
                                         before["property"].string(), person);
        _undone.memberships++;
    }

    CXHistory& _history;
    CXRolvane& _rolvane;
    CXUndone _undone;
    std::map<UniqueId, UniqueId> _instead; // of records that came back under another identifier
};

CXUndone CXHistory::undo(int64_t change) {
    return Undoing(*this, _rolvane).undo(change);
}

void CXHistory::noteUndone(int64_t change) {
    std::lock_guard lock(_rolvane.impl().mutex);
    SqliteTransaction transaction(_rolvane.impl().sqlite);
    _rolvane.impl().changeLog.setUndone(change);
    transaction.commit();
}

void CXHistory::forget(const UniqueId& uid) {
    CXRolvane::Impl& impl = _rolvane.impl();
    std::lock_guard lock(impl.mutex);
    impl.sqlite.execute("PRAGMA secure_delete=ON");
    SqliteTransaction transaction(impl.sqlite);
    impl.changeLog.forget(uid);
    impl.sqlite.statement("DELETE FROM conflicts WHERE uid=?").bind(1, uid.str()).run();
    if (impl.formerVersions.areKept()) impl.sqlite.statement("DELETE FROM former WHERE uid=?").bind(1, uid.str()).run();
    transaction.commit();
    impl.sqlite.execute("PRAGMA secure_delete=OFF; PRAGMA wal_checkpoint(TRUNCATE)");
}

} // namespace rolvane
