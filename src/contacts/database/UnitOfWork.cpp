#include "contacts/database/UnitOfWork.h"

#include "foundation/PropertyList.h"

#include <algorithm>

namespace rolvane {

Dictionary PendingRecord::over(const Dictionary& stored) const {
    Dictionary result = whole      ? BinaryValue::decode(*whole).dictionary()
                        : replaced ? Dictionary()
                                   : stored.mutableCopy();
    for (const auto& [property, value] : changes) {
        if (value.isAbsent())
            result.remove(property);
        else
            result.set(property, value);
    }
    return result;
}

void PendingMembership::add(const UniqueId& member) {
    if (removed.erase(member)) return; // keeps its place
    if (addedSet.emplace(member, added.size()).second) added.push_back(member);
}

bool PendingMembership::takeBack(const UniqueId& member) {
    auto found = addedSet.find(member);
    if (found == addedSet.end()) return false;
    added[found->second] = UniqueId();
    addedSet.erase(found);
    return true;
}

void PendingMembership::remove(const UniqueId& member) {
    choices.erase(member);
    choicesDropped.insert(member);
    if (!takeBack(member)) removed.insert(member);
}

void PendingMembership::forget(const UniqueId& member) {
    takeBack(member);
    removed.erase(member);
    choices.erase(member);
    choicesDropped.erase(member);
}

void UnitOfWork::clear() {
    _records.clear();
    _memberships.clear();
    _shareCount.reset();
    _commonVersions.clear();
    _sentVersions.clear();
    _conflicts.clear();
    _size = 0;
}

void UnitOfWork::replace(PendingRecord& record, const Dictionary& properties) {
    if (record.whole) _size -= record.whole->size();
    record.replaced = true;
    record.changes.clear();
    record.whole = std::make_shared<const Bytes>(BinaryValue::encode(properties));
    _size += record.whole->size();
}

void UnitOfWork::setCommonVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties) {
    _commonVersions[uid] = std::move(properties);
    _sentVersions.erase(uid);
}

void UnitOfWork::setSentVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties) {
    _sentVersions[uid] = std::move(properties);
}

const PendingRecord* UnitOfWork::find(const UniqueId& uid) const {
    auto found = _records.find(uid);
    return found == _records.end() ? nullptr : &found->second;
}

PendingRecord& UnitOfWork::touch(const UniqueId& uid, RecordKind kind, bool inStore, Date now) {
    auto [at, made] = _records.try_emplace(uid);
    if (made) {
        at->second.order = _nextOrder++;
        at->second.kind = kind;
        at->second.inStore = inStore;
    }
    at->second.touched = now;
    return at->second;
}

PendingRecord& UnitOfWork::insert(const UniqueId& uid, RecordKind kind, bool inStore, Date now) {
    PendingRecord& record = touch(uid, kind, inStore, now);
    bool wasDeleted = record.deleted;
    if (wasDeleted && record.inStore) record.purged = true;
    if (wasDeleted) record.order = _nextOrder++;
    record.kind = kind;
    record.deleted = false;
    replace(record, {});
    return record;
}

void UnitOfWork::remove(const UniqueId& uid, RecordKind kind, bool inStore, Date now) {
    for (auto at = _memberships.begin(); at != _memberships.end();) {
        at->second.forget(uid);
        bool drop = at->first == uid || at->second.empty();
        at = drop ? _memberships.erase(at) : std::next(at);
    }
    _commonVersions.erase(uid);
    _sentVersions.erase(uid);
    PendingRecord& record = touch(uid, kind, inStore, now);
    if (record.whole) _size -= record.whole->size();
    record.whole.reset();
    record.knownRow.reset();
    if (!record.inStore) {
        _records.erase(uid);
        return;
    }
    record.deleted = true;
    record.purged = false;
    record.replaced = false;
    record.changes.clear();
}

bool UnitOfWork::isGone(const UniqueId& uid) const {
    const PendingRecord* record = find(uid);
    return record && record->deleted;
}

bool UnitOfWork::hidesStoredLinks(const UniqueId& uid) const {
    const PendingRecord* record = find(uid);
    return record && (record->deleted || record->purged);
}

bool UnitOfWork::changesMemberships() const {
    return !_memberships.empty() || std::any_of(_records.begin(), _records.end(), [](const auto& entry) {
        return !isPerson(entry.second.kind) && (entry.second.deleted || entry.second.purged);
    });
}

const PendingMembership* UnitOfWork::membershipIf(const UniqueId& group) const {
    auto found = _memberships.find(group);
    return found == _memberships.end() ? nullptr : &found->second;
}

void UnitOfWork::dropEmptyMembership(const UniqueId& group) {
    auto found = _memberships.find(group);
    if (found != _memberships.end() && found->second.empty()) _memberships.erase(found);
}

std::vector<std::pair<UniqueId, const PendingRecord*>> UnitOfWork::inOrder() const {
    std::vector<std::pair<UniqueId, const PendingRecord*>> all;
    all.reserve(_records.size());
    for (const auto& [uid, record] : _records) all.emplace_back(uid, &record);
    std::sort(all.begin(), all.end(), [](const auto& a, const auto& b) { return a.second->order < b.second->order; });
    return all;
}

} // namespace rolvane
