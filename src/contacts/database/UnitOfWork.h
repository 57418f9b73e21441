#pragma once

#include "contacts/database/ConflictLog.h"
#include "contacts/records/RecordKind.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

namespace rolvane {

// What this process has changed in one record and not saved yet.
struct PendingRecord {
    uint64_t order = 0; // of the first change, or of the addition; inserted rows are written in this order
    RecordKind kind = RecordKind::none;
    bool inStore = false; // there was a row when the record was first touched
    bool deleted = false;
    bool purged = false;   // the row was removed before a new record of the identifier was added
    bool replaced = false; // nothing stored counts any more: `whole` with `changes` are all properties there are
    // Properties that were given as a whole, encoded: 50,000 records must not stand in memory as trees of objects.
    std::shared_ptr<const Bytes> whole;
    // The stored properties that the replacement knew, or a person's before the first change: what another process has
    // changed in them since is kept.
    std::shared_ptr<const Bytes> knownRow;
    std::map<std::string, Value, std::less<>> changes; // an absent value: the property is removed
    std::string location;                              // as it is with the changes
    Date touched;

    bool isInsertion() const { return !deleted && (!inStore || purged); }
    bool changesProperties() const { return replaced || !changes.empty(); }
    // The stored row (or nothing) with the changes laid over it: a new dictionary.
    Dictionary over(const Dictionary& stored) const;
};

// What has changed in the lists of one group. Names members and subgroups alike.
struct PendingMembership {
    std::vector<UniqueId> added;                   // in order; an empty one was taken back
    std::unordered_map<UniqueId, size_t> addedSet; // with the places
    std::set<UniqueId> removed;
    std::set<UniqueId> choicesDropped; // people whose stored choices are void
    std::map<UniqueId, std::map<std::string, std::optional<std::string>>> choices;

    void add(const UniqueId& member);
    void remove(const UniqueId& member);   // with the choices
    bool takeBack(const UniqueId& member); // what was added and is in no list yet
    void forget(const UniqueId& member);   // the record is gone: nothing of it is left to write
    bool empty() const { return addedSet.empty() && removed.empty() && choicesDropped.empty() && choices.empty(); }
};

// The unsaved changes of a database object. Pure bookkeeping: knows no file and no lock.
class UnitOfWork {
public:
    bool empty() const {
        return _records.empty() && _memberships.empty() && !_shareCount && _commonVersions.empty() &&
               _sentVersions.empty() && _conflicts.empty();
    }
    void clear();

    const PendingRecord* find(const UniqueId& uid) const;
    // The entry of a record, made when there is none.
    PendingRecord& touch(const UniqueId& uid, RecordKind kind, bool inStore, Date now);
    // A record of the identifier is added: whatever the row was, it is this now, last in order.
    PendingRecord& insert(const UniqueId& uid, RecordKind kind, bool inStore, Date now);
    // A record is removed. One that was only added here leaves no trace.
    void remove(const UniqueId& uid, RecordKind kind, bool inStore, Date now);

    bool isGone(const UniqueId& uid) const;           // removed, whatever comes after
    bool hidesStoredLinks(const UniqueId& uid) const; // stored memberships of it count no more
    bool changesMemberships() const;                  // of anything
    bool isRecordWithChanges(const UniqueId& uid) const { return _records.contains(uid); }

    PendingMembership& membership(const UniqueId& group) { return _memberships[group]; }
    const PendingMembership* membershipIf(const UniqueId& group) const;
    const std::map<UniqueId, PendingMembership>& memberships() const { return _memberships; }
    void dropEmptyMembership(const UniqueId& group);
    // Bytes of the properties that were given as a whole, a measure of what the changes hold in memory.
    size_t size() const { return _size; }
    void replace(PendingRecord& record, const Dictionary& properties);

    std::vector<std::pair<UniqueId, const PendingRecord*>> inOrder() const;
    const std::unordered_map<UniqueId, PendingRecord>& records() const { return _records; }

    // By contact, the properties that both sides have had.
    using CommonVersionsOf = std::unordered_map<UniqueId, std::shared_ptr<const Bytes>>;
    const CommonVersionsOf& commonVersions() const { return _commonVersions; }
    void setCommonVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties);
    const CommonVersionsOf& sentVersions() const { return _sentVersions; } // on their way
    void setSentVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties);
    const std::vector<CXConflict>& conflicts() const { return _conflicts; }
    void addConflict(CXConflict conflict) { _conflicts.push_back(std::move(conflict)); }

    const std::optional<int64_t>& shareCount() const { return _shareCount; }
    void setShareCount(int64_t count) { _shareCount = count; }

private:
    std::unordered_map<UniqueId, PendingRecord> _records;
    std::map<UniqueId, PendingMembership> _memberships;
    std::optional<int64_t> _shareCount;
    CommonVersionsOf _commonVersions, _sentVersions;
    std::vector<CXConflict> _conflicts;
    uint64_t _nextOrder = 1;
    size_t _size = 0;
};

} // namespace rolvane
