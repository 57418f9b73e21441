// Changes to the unit of work, and the handles.

#include "contacts/database/RolvaneImpl.h"

#include "foundation/Log.h"

namespace rolvane {

bool isKeptByDatabase(std::string_view property) {
    return property == kCXUIDProperty || property == kCXCreationDateProperty || property == kCXModificationDateProperty;
}

bool mayHave(RecordKind kind, std::string_view property, const Value& value) {
    if (isKeptByDatabase(property)) return false;
    if (isGroup(kind) && property == kCXGroupNameProperty) return value.isString() && !value.string().empty();
    return true;
}

RecordKind kindOfRecord(const CXRecord& record) {
    if (dynamic_cast<const CXSubscribedPerson*>(&record)) return RecordKind::subscribedPerson;
    if (dynamic_cast<const CXPerson*>(&record)) return RecordKind::person;
    if (dynamic_cast<const CXAllGroup*>(&record))
        return cxIsSubscribed(record.uniqueId()) ? RecordKind::allSubscribedGroup : RecordKind::allGroup;
    if (dynamic_cast<const CXSubscribedGroup*>(&record)) return RecordKind::subscribedGroup;
    if (dynamic_cast<const CXGroup*>(&record)) return RecordKind::group;
    if (dynamic_cast<const CXSubscription*>(&record)) return RecordKind::subscription;
    return RecordKind::none;
}

CXRecord* CXRolvane::Impl::makeHandle(const UniqueId& uid, RecordKind is) {
    switch (is) {
    case RecordKind::person: return new CXPerson(uid, anchor);
    case RecordKind::subscribedPerson: return new CXSubscribedPerson(uid, anchor);
    case RecordKind::group: return new CXGroup(uid, anchor);
    case RecordKind::subscribedGroup: return new CXSubscribedGroup(uid, anchor);
    case RecordKind::allGroup:
    case RecordKind::allSubscribedGroup: return new CXAllGroup(uid, anchor);
    case RecordKind::subscription: return new CXSubscription(uid, anchor);
    case RecordKind::groupContents: return new CXGroupContents(uid, anchor);
    case RecordKind::info: return new CXInfo(uid, anchor);
    case RecordKind::none: break;
    }
    return nullptr;
}

CXRecordRef CXRolvane::Impl::handle(const UniqueId& uid) {
    RecordKind is = kind(uid);
    if (is == RecordKind::none) return nullptr;
    if (auto found = _handles.find(uid); found != _handles.end())
        if (CXRecordRef alive = found->second.lock()) return alive;
    CXRecordRef made(makeHandle(uid, is));
    if (_handles.size() >= _handleLimit) {
        std::erase_if(_handles, [](const auto& entry) { return entry.second.expired(); });
        _handleLimit = std::max<size_t>(1024, _handles.size() * 2);
    }
    _handles[uid] = made;
    return made;
}

void CXRolvane::Impl::adopt(const CXRecordRef& record) {
    record->_owner = anchor;
    record->_isDetached = false;
    record->_detached = Dictionary();
    _handles[record->uniqueId()] = record;
}

PendingRecord& CXRolvane::Impl::pending(const UniqueId& uid) {
    RecordKind is = kind(uid);
    bool known = work.find(uid) != nullptr;
    std::string was = known ? std::string() : location(uid);
    const std::optional<StoredRow> row = storedRow(uid);
    PendingRecord& p = work.touch(uid, is, row.has_value(), clock.now());
    if (!known) p.location = was;
    if (!known && row && isPerson(is)) p.knownRow = row->properties;
    return p;
}

bool CXRolvane::Impl::setProperty(const UniqueId& uid, std::string_view name, Value value) {
    RecordKind is = kind(uid);
    if (is == RecordKind::none || is >= RecordKind::groupContents || !mayHave(is, name, value)) return false;
    if (is == RecordKind::subscription && name == kCXRemoteLocationProperty) return false;
    PendingRecord& p = pending(uid);
    if (value.isAbsent() && p.replaced && !p.whole)
        p.changes.erase(std::string(name));
    else
        p.changes[std::string(name)] = value.deepMutableCopy();
    if (name == kCXRemoteLocationProperty) p.location = locationOf(is, properties(uid));
    return true;
}

void CXRolvane::Impl::replaceProperties(const UniqueId& uid, Dictionary fresh) {
    RecordKind is = kind(uid);
    if (is == RecordKind::none || is >= RecordKind::groupContents) return;
    const char* keeps = isGroup(is)                      ? kCXGroupNameProperty
                        : is == RecordKind::subscription ? kCXRemoteLocationProperty
                                                         : nullptr;
    if (keeps && (is == RecordKind::subscription || !mayHave(is, keeps, fresh[keeps])))
        fresh.set(keeps, property(uid, keeps));
    for (const char* kept : {kCXUIDProperty, kCXCreationDateProperty, kCXModificationDateProperty}) fresh.remove(kept);
    PendingRecord& p = pending(uid);
    work.replace(p, fresh);
    // The first change was made against that row, and this replacement is made of it.
    if (const auto& row = storedRow(uid); row && !p.isInsertion() && !p.knownRow) p.knownRow = row->properties;
    p.location = locationOf(is, fresh);
}

void CXRolvane::Impl::insert(const UniqueId& uid, RecordKind is, const Dictionary& fresh) {
    const auto row = storedRow(uid);
    PendingRecord& p = work.insert(uid, is, row.has_value(), clock.now());
    work.replace(p, fresh);
    if (row && !p.isInsertion()) p.knownRow = row->properties;
    p.location = locationOf(is, fresh);
}

bool CXRolvane::Impl::remove(const UniqueId& uid) {
    RecordKind is = kind(uid);
    if (is == RecordKind::none || is >= RecordKind::groupContents) return false;
    if (isAllKind(is)) {
        CXLog("An all-contacts group cannot be removed; %@ stays.", uid);
        return false;
    }
    std::string of = location(uid);
    if (is == RecordKind::subscription && of == kCXLocalRemoteLocation) {
        CXLog("The subscription to the owner's own data cannot be removed; it stays.");
        return false;
    }
    if (is == RecordKind::subscription) {
        for (RecordKind copies :
             {RecordKind::subscribedGroup, RecordKind::subscribedPerson, RecordKind::allSubscribedGroup})
            for (const UniqueId& copy : recordsOf(copies, of))
                work.remove(copy, copies, storedRow(copy).has_value(), clock.now());
    }
    work.remove(uid, is, storedRow(uid).has_value(), clock.now());
    return true;
}

bool CXRolvane::Impl::list(const UniqueId& group, const UniqueId& member) {
    if (isListed(group, member)) return false;
    work.membership(group).add(member);
    work.dropEmptyMembership(group);
    return true;
}

bool CXRolvane::Impl::unlist(const UniqueId& group, const UniqueId& member) {
    if (!isListed(group, member)) return false;
    work.membership(group).remove(member);
    return true;
}

void CXRolvane::Impl::setChoice(const UniqueId& group, const UniqueId& person, const std::string& property,
                                const std::optional<std::string>& identifier) {
    if (choice(group, person, property) == identifier) return;
    work.membership(group).choices[person][property] = identifier;
}

} // namespace rolvane
