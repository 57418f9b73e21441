// What is stored, with the unit of work laid over it.

#include "contacts/database/RolvaneImpl.h"

#include "foundation/PropertyList.h"

#include <algorithm>
#include <limits>

namespace rolvane {

CXRolvane::OneMoment::OneMoment(CXRolvane& rolvane) : _rolvane(rolvane) {
    std::lock_guard lock(_rolvane._impl->mutex);
    _snapshot = std::make_unique<SqliteSnapshot>(_rolvane._impl->sqlite);
}

CXRolvane::OneMoment::~OneMoment() {
    std::lock_guard lock(_rolvane._impl->mutex);
    _snapshot.reset();
}

namespace {

const Dictionary kNoProperties;
constexpr size_t kCachedRows = 256;
constexpr size_t kKeptList = 20000; // members of the group whose list is kept
// Row numbers of records that are not saved yet come after all stored ones, in order of their addition.
constexpr int64_t kUnsavedRow = int64_t{1} << 60;

bool isOlder(const std::pair<int64_t, UniqueId>& a, const std::pair<int64_t, UniqueId>& b) {
    return a.first < b.first;
}

std::vector<UniqueId> byAge(std::vector<std::pair<int64_t, UniqueId>> records) {
    if (!std::is_sorted(records.begin(), records.end(), isOlder)) std::sort(records.begin(), records.end(), isOlder);
    std::vector<UniqueId> all;
    all.reserve(records.size());
    for (auto& [number, uid] : records) all.push_back(std::move(uid));
    return all;
}

// The group whose contents the identifier stands for.
UniqueId groupOfContents(const UniqueId& uid) {
    bool subscribed = cxTableName(uid) == kCXSubscribedGroupContentsTable;
    return cxUIDWithTableName(uid, subscribed ? kCXSubscribedGroupTable : kCXGroupTable);
}

} // namespace

CXRolvane::Impl::CachedRow& CXRolvane::Impl::cached(const UniqueId& uid) {
    uint64_t now = store.generation();
    if (now != _rowsGeneration || _rows.size() > kCachedRows) _rows.clear();
    _rowsGeneration = now;
    auto [at, made] = _rows.try_emplace(uid);
    if (made) at->second.row = store.row(uid);
    return at->second;
}

const std::optional<StoredRow>& CXRolvane::Impl::storedRow(const UniqueId& uid) {
    return cached(uid).row;
}

const Dictionary& CXRolvane::Impl::storedProperties(const UniqueId& uid) {
    CachedRow& row = cached(uid);
    if (!row.row) return kNoProperties;
    if (!row.decoded) row.decoded = BinaryValue::decode(*row.row->properties).dictionary();
    return *row.decoded;
}

RecordKind CXRolvane::Impl::kind(const UniqueId& uid) {
    if (const PendingRecord* p = work.find(uid)) {
        bool vanished = !p->deleted && !p->isInsertion() && !storedRow(uid); // removed by another process
        return p->deleted || vanished ? RecordKind::none : p->kind;
    }
    if (const auto& row = storedRow(uid)) return row->kind;
    RecordKind named = kindOfTable(cxTableName(uid));
    if (named == RecordKind::groupContents && isPlainGroup(kind(groupOfContents(uid)))) return named;
    if (named == RecordKind::info && cxUUIDPart(uid) == identity) return named;
    return RecordKind::none;
}

Dictionary CXRolvane::Impl::properties(const UniqueId& uid) {
    if (kind(uid) == RecordKind::none) return {};
    const PendingRecord* p = work.find(uid);
    if (!p) return storedProperties(uid).mutableCopy();
    return p->over(p->replaced ? kNoProperties : storedProperties(uid));
}

Value CXRolvane::Impl::property(const UniqueId& uid, std::string_view name) {
    RecordKind is = kind(uid);
    if (is == RecordKind::none) return {};
    if (name == kCXUIDProperty) return uid;
    if (name == kCXModificationDateProperty) return modified(uid);
    const PendingRecord* p = work.find(uid);
    if (name == kCXCreationDateProperty) {
        if (p && p->isInsertion()) return p->touched;
        const auto& row = storedRow(uid);
        return row ? Value(row->created) : Value();
    }
    if (p) {
        if (auto changed = p->changes.find(name); changed != p->changes.end()) return changed->second.deepMutableCopy();
        if (p->whole) return BinaryValue::decode(*p->whole).dictionary()[name];
        if (p->replaced) return {};
    }
    return storedProperties(uid)[name].deepMutableCopy();
}

std::shared_ptr<const Bytes> CXRolvane::Impl::encoded(const UniqueId& uid) {
    const PendingRecord* p = work.find(uid);
    if (p && p->whole && p->changes.empty()) return p->whole;
    if (!p) {
        if (const auto& row = storedRow(uid)) return row->properties;
    }
    return std::make_shared<const Bytes>(BinaryValue::encode(properties(uid)));
}

std::string CXRolvane::Impl::location(const UniqueId& uid) {
    if (kind(uid) == RecordKind::none) return {};
    if (const PendingRecord* p = work.find(uid)) return p->location;
    const auto& row = storedRow(uid);
    return row ? row->location : std::string();
}

Date CXRolvane::Impl::modified(const UniqueId& uid) {
    const PendingRecord* p = work.find(uid);
    if (p) return p->touched;
    if (work.membershipIf(uid)) return clock.now();
    const auto& row = storedRow(uid);
    return row ? row->modified : Date();
}

std::optional<CXRow> CXRolvane::Impl::row(const UniqueId& uid, bool withParents) {
    if (!isPerson(kind(uid))) return std::nullopt;
    CXRow row;
    row.uniqueId = uid;
    row.sharingUniqueId = cxNormalizedUID(uid);
    row.location = RemoteLocation(location(uid));
    row.modified = modified(uid);
    row.created = property(uid, kCXCreationDateProperty).date().value_or(Date());
    row.encoded = encoded(uid);
    row.writer = work.find(uid) || !storedRow(uid) ? options.program : storedRow(uid)->writer;
    if (withParents) row.parentGroups = parents(uid);
    return row;
}

std::vector<UniqueId> CXRolvane::Impl::recordsOf(RecordKind wanted, const std::optional<std::string>& location) {
    auto records = store.recordsOf(wanted, location);
    if (work.records().empty()) return byAge(std::move(records));
    std::erase_if(records, [&](const auto& r) { return work.isRecordWithChanges(r.second); });
    for (const auto& [uid, p] : work.inOrder()) {
        if (p->deleted || p->kind != wanted || (location && p->location != *location)) continue;
        int64_t number = p->isInsertion() ? kUnsavedRow + static_cast<int64_t>(p->order) : store.rowNumber(uid);
        if (number != 0) records.emplace_back(number, uid);
    }
    return byAge(std::move(records));
}

std::vector<UniqueId> CXRolvane::Impl::sharedFormsOf(RecordKind wanted, const std::optional<std::string>& location,
                                                     SharedForms& forms) {
    if (work.records().empty()) // they get no text of their own in between
        return byAge(store.recordsOf(wanted, location, [&](std::string_view uid) { return forms.of(uid); }));
    return forms.of(recordsOf(wanted, location));
}

size_t CXRolvane::Impl::countOf(RecordKind wanted, const std::optional<std::string>& location) {
    if (work.records().empty()) return static_cast<size_t>(store.countOf(wanted, location));
    return recordsOf(wanted, location).size();
}

const CXRolvane::Impl::StoredList& CXRolvane::Impl::storedList(const UniqueId& group) {
    const uint64_t now = store.generation();
    if (now == _listGeneration && group == _listedGroup) return _list;
    _list = store.listed(group);
    _listGeneration = _list.size() <= kKeptList ? now : 0;
    _listedGroup = group;
    return _list;
}

std::vector<UniqueId> CXRolvane::Impl::listed(const UniqueId& group, bool groups) {
    std::vector<UniqueId> all;
    if (!work.hidesStoredLinks(group))
        for (const auto& [uid, is] : storedList(group))
            if (groups ? isPlainGroup(is) : isPerson(is)) all.push_back(uid);
    if (work.empty()) return all;
    const PendingMembership* changes = work.membershipIf(group);
    std::erase_if(all, [&](const UniqueId& uid) {
        return work.hidesStoredLinks(uid) ||
               (changes && (changes->removed.contains(uid) || changes->addedSet.contains(uid)));
    });
    if (!changes) return all;
    for (const UniqueId& uid : changes->added) {
        if (uid.empty()) continue;
        RecordKind is = kind(uid);
        if (groups ? isPlainGroup(is) : isPerson(is)) all.push_back(uid);
    }
    return all;
}

bool CXRolvane::Impl::isListed(const UniqueId& group, const UniqueId& member) {
    if (const PendingMembership* changes = work.membershipIf(group)) {
        if (changes->addedSet.contains(member)) return true;
        if (changes->removed.contains(member)) return false;
    }
    if (work.hidesStoredLinks(group) || work.hidesStoredLinks(member)) return false;
    return store.isListed(group, member);
}

std::vector<UniqueId> CXRolvane::Impl::parents(const UniqueId& member) {
    if (kind(member) == RecordKind::none) return {};
    std::vector<std::pair<int64_t, UniqueId>> records;
    if (!work.hidesStoredLinks(member)) records = store.parents(member);
    if (work.empty()) return byAge(std::move(records));
    std::erase_if(records, [&](const auto& r) {
        const PendingMembership* changes = work.membershipIf(r.second);
        return work.hidesStoredLinks(r.second) ||
               (changes && (changes->removed.contains(member) || changes->addedSet.contains(member)));
    });
    for (const auto& [group, changes] : work.memberships()) {
        if (!changes.addedSet.contains(member)) continue;
        const PendingRecord* p = work.find(group);
        bool isNew = p && p->isInsertion();
        int64_t number = isNew ? kUnsavedRow + static_cast<int64_t>(p->order) : store.rowNumber(group);
        if (number != 0) records.emplace_back(number, group);
    }
    return byAge(std::move(records));
}

std::optional<std::string> CXRolvane::Impl::choice(const UniqueId& group, const UniqueId& person,
                                                   const std::string& property) {
    if (const PendingMembership* changes = work.membershipIf(group)) {
        if (auto of = changes->choices.find(person); of != changes->choices.end())
            if (auto found = of->second.find(property); found != of->second.end()) return found->second;
        if (changes->choicesDropped.contains(person)) return std::nullopt;
    }
    if (work.hidesStoredLinks(group) || work.hidesStoredLinks(person)) return std::nullopt;
    return store.choice(group, person, property);
}

std::map<UniqueId, CXDistributionChoices> CXRolvane::Impl::choicesOfGroup(const UniqueId& group) {
    const PendingMembership* changes = work.membershipIf(group);
    std::map<UniqueId, CXDistributionChoices> all;
    auto counts = [&](const StoredChoice& c) {
        if (work.hidesStoredLinks(c.record) || (changes && changes->removed.contains(c.record))) return false;
        if (changes && changes->choicesDropped.contains(c.record)) return false;
        // A person with unsaved changes is judged by what it is now.
        return work.find(c.record) ? properties(c.record).contains(c.property) : c.propertyIsUsed;
    };
    if (!work.hidesStoredLinks(group))
        for (const StoredChoice& c : store.choicesOfGroup(group))
            if (counts(c)) all[c.record][c.property] = c.identifier;
    if (!changes) return all;
    // Unsaved choices, and what is stored for people who are not stored as members yet.
    std::set<UniqueId> people;
    for (const auto& [person, place] : changes->addedSet) people.insert(person);
    for (const auto& [person, chosen] : changes->choices) people.insert(person);
    for (const UniqueId& person : people) {
        all.erase(person);
        if (!isPerson(kind(person)) || !isListed(group, person)) continue;
        for (const auto& [name, value] : properties(person))
            if (auto identifier = choice(group, person, name)) all[person][name] = *identifier;
    }
    return all;
}

std::map<UniqueId, CXDistributionChoices> CXRolvane::Impl::choicesOfPerson(const UniqueId& person) {
    std::map<UniqueId, CXDistributionChoices> all;
    if (kind(person) == RecordKind::none) return all;
    std::set<UniqueId> groups;
    for (const StoredChoice& c : store.choicesOfPerson(person)) groups.insert(c.record);
    for (const auto& [group, changes] : work.memberships())
        if (changes.choices.contains(person)) groups.insert(group);
    if (groups.empty()) return all;
    Dictionary used = properties(person);
    for (const UniqueId& group : groups)
        for (const auto& [name, value] : used)
            if (auto identifier = choice(group, person, name)) all[group][name] = *identifier;
    return all;
}

} // namespace rolvane
