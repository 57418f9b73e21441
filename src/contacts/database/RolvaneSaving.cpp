// One save: one transaction, one journal entry a record, one signal.

#include "contacts/database/DaemonMemory.h"
#include "contacts/database/RolvaneImpl.h"
#include "contacts/records/ContactMerge.h"

#include "foundation/Log.h"
#include "foundation/PropertyList.h"

#include <unistd.h>

namespace rolvane {

namespace {

// Writes a unit of work into an open transaction.
class Saver {
public:
    Saver(CXRolvane::Impl& database, Date date)
        : _store(database.store), _journal(database.journal), _commonVersions(database.commonVersions),
          _conflicts(database.conflicts), _formerVersions(database.formerVersions), _log(database.changeLog),
          _identity(database.identity), _program(database.options.program), _date(date) {}

    void write(const UnitOfWork& work) {
        _work = &work;
        _log.begin(_program, _date);
        auto records = work.inOrder();
        for (const auto& [uid, record] : records)
            if (record->deleted && record->kind == RecordKind::subscription)
                if (const std::optional<StoredRow> row = _store.row(uid)) _endedLocations.insert(row->location);
        for (const auto& [uid, record] : records)
            if (record->deleted || record->purged) removeRecord(uid, *record);
        for (const auto& [uid, record] : records)
            if (!record->deleted) writeRecord(uid, *record);
        writeMemberships(work.memberships());
        for (const auto& [uid, properties] : work.commonVersions()) _commonVersions.set(uid, *properties);
        for (const auto& [uid, properties] : work.sentVersions()) _commonVersions.addSent(uid, *properties);
        for (const CXConflict& conflict : work.conflicts()) _conflicts.note(conflict);
        if (work.shareCount()) _store.setShareCount(*work.shareCount());
        if (_save) _journal.prune();
        if (_keptFormer) _formerVersions.prune();
        _log.finish();
    }
    bool changedRecords() const { return _save != 0; }

private:
    void note(const UniqueId& uid, CXChangeKind kind) {
        if (!_save) _save = _journal.beginSave(::getpid(), _program, _date);
        _journal.note(_save, uid, kind);
        _noted.insert(uid);
    }

    static bool isLogged(RecordKind kind) { return !isAllKind(kind) && (isPerson(kind) || isGroup(kind)); }

    // The record last: what is taken back begins with it.
    void logRemoval(const StoredRow& row) {
        if (!isLogged(row.kind) || (cxIsSubscribed(row.uid) && _endedLocations.contains(row.location))) return;
        for (const auto& [number, group] : _store.parents(row.uid)) _log.note(row.uid, CXDetailKind::left, group);
        if (isPerson(row.kind)) {
            for (const StoredChoice& choice : _store.choicesOfPerson(row.uid))
                logChoice(row.uid, choice.record, choice.property, choice.identifier);
        } else {
            for (const auto& [member, kind] : _store.listed(row.uid)) _log.note(member, CXDetailKind::left, row.uid);
            for (const StoredChoice& choice : _store.choicesOfGroup(row.uid))
                logChoice(choice.record, row.uid, choice.property, choice.identifier);
        }
        _log.note(row.uid, CXDetailKind::deleted, {}, row.properties.get());
    }

    void logChoice(const UniqueId& person, const UniqueId& group, const std::string& property,
                   const std::optional<std::string>& before) {
        Dictionary choice{{"property", property}};
        if (before) choice.set("identifier", *before);
        const Bytes encoded = BinaryValue::encode(choice);
        _log.note(person, CXDetailKind::chosen, group, &encoded);
    }

    void removeRow(const StoredRow& row) {
        logRemoval(row);
        _store.touchParents(row.id, _date);
        _store.removeRow(row.id);
    }

    void removeRecord(const UniqueId& uid, const PendingRecord& record) {
        std::optional<StoredRow> row = _store.row(uid);
        if (!row) return; // another process was faster
        removeRow(*row);
        if (record.purged) return; // a new record of the identifier follows
        if (!isAllKind(row->kind)) note(uid, CXChangeKind::deleted);
        if (row->kind == RecordKind::subscription) removeCopies(row->location);
    }

    // What other processes have added to a location since its removal was asked for. What was changed here was removed
    // with it already, or has moved to another location.
    void removeCopies(const std::string& location) {
        for (RecordKind kind :
             {RecordKind::subscribedGroup, RecordKind::subscribedPerson, RecordKind::allSubscribedGroup})
            for (const auto& [number, uid] : _store.recordsOf(kind, location)) {
                if (_work->isRecordWithChanges(uid)) continue;
                _store.removeRow(number);
                if (!isAllKind(kind)) note(uid, CXChangeKind::deleted);
            }
    }

    void writeRecord(const UniqueId& uid, const PendingRecord& record) {
        std::optional<StoredRow> row = _store.row(uid);
        if (!row && record.isInsertion()) {
            if (isSubscribedMeanwhile(record)) return;
            Dictionary properties = record.over({});
            _store.insertRow(uid, record.kind, properties, encodedOf(record, properties), _date, _program);
            if (!isAllKind(record.kind)) note(uid, CXChangeKind::inserted);
            if (isLogged(record.kind)) _log.note(uid, CXDetailKind::added);
            return;
        }
        if (!row) {
            CXLog("%@ was removed by another program; the changes made to it here are dropped.", uid);
            return;
        }
        if (record.changesProperties()) updateRow(uid, record, *row);
    }

    // Two processes that subscribe to one location at a time: the first one's subscription serves both.
    bool isSubscribedMeanwhile(const PendingRecord& record) {
        bool once = record.kind == RecordKind::subscription || record.kind == RecordKind::allSubscribedGroup;
        return once && _store.firstOfLocation(record.kind, record.location).has_value();
    }

    // A change that another process has overtaken: what it changed stays as it left it, and of one list both changes.
    Dictionary withChangesOfOthers(const Dictionary& ours, const PendingRecord& record, const StoredRow& row) {
        const Dictionary before = BinaryValue::decode(*record.knownRow).dictionary();
        const Dictionary theirs = BinaryValue::decode(*row.properties).dictionary();
        if (isPerson(record.kind)) {
            // A replacement gives way to what was typed meanwhile; of two edits the later save's stands.
            const CXSide stands = record.replaced ? CXSide::ours : CXSide::theirs;
            CXMergeResult merge = mergedContact(before, theirs, ours, stands);
            Dictionary& contact = merge.contact;
            for (CXMergeConflict& each : merge.conflicts)
                _conflicts.note({0, row.uid, deriveColumns(row.kind, contact).display, _date, std::move(each)});
            const bool moved = theirs[kCXRemoteLocationProperty] != before[kCXRemoteLocationProperty];
            if (const Value& place = (moved ? theirs : ours)[kCXRemoteLocationProperty])
                contact.set(kCXRemoteLocationProperty, place);
            return contact;
        }
        Dictionary all = ours.mutableCopy();
        for (const auto& [property, value] : theirs)
            if (value != before[property]) all.set(property, value);
        for (const auto& [property, value] : before)
            if (!theirs.contains(property)) all.remove(property);
        return all;
    }

    static Bytes encodedOf(const PendingRecord& record, const Dictionary& properties) {
        return record.whole && record.changes.empty() ? *record.whole : BinaryValue::encode(properties);
    }

    void updateRow(const UniqueId& uid, const PendingRecord& record, const StoredRow& row) {
        const bool changedMeanwhile = record.knownRow && *record.knownRow != *row.properties;
        const Bytes& known = changedMeanwhile ? *record.knownRow : *row.properties;
        Dictionary after = record.over(record.replaced ? Dictionary() : BinaryValue::decode(known).dictionary());
        if (changedMeanwhile) after = withChangesOfOthers(after, record, row);
        Bytes encoded = changedMeanwhile ? BinaryValue::encode(after) : encodedOf(record, after);
        if (encoded == *row.properties && record.kind == row.kind) return; // nothing has changed after all
        if (isPerson(row.kind) && !_work->commonVersions().contains(uid))
            _commonVersions.keep(row.id, *row.properties, _date);
        keepFormer(row);
        if (isLogged(row.kind)) _log.note(row.uid, CXDetailKind::changed, {}, row.properties.get());
        _store.updateRow(row.id, record.kind, after, encoded, _date,
                         changedMeanwhile && record.replaced ? row.writer : _program); // it holds an edit of theirs
        note(record.kind == RecordKind::allGroup ? UniqueId(_identity + ":" + std::string(kCXInfoTable)) : uid,
             CXChangeKind::updated);
    }

    void keepFormer(const StoredRow& row) {
        if (!isLogged(row.kind)) return;
        if (!_areFormerKept) _areFormerKept = _formerVersions.areKept();
        if (!*_areFormerKept) return;
        _formerVersions.keep(row.uid, row.modified, _date, *row.properties);
        _keptFormer = true;
    }

    // All that leaves before all that joins: of groups that are turned round, one can only come below the other when
    // that one has left it.
    void writeMemberships(const std::map<UniqueId, PendingMembership>& memberships) {
        std::vector<GroupToWrite> groups;
        for (const auto& [group, changes] : memberships)
            if (const int64_t number = _store.rowNumber(group); number != 0)
                groups.push_back({group, number, changes, false});
        for (GroupToWrite& group : groups) takeOut(group);
        for (GroupToWrite& group : groups) putIn(group);
        for (const GroupToWrite& group : groups)
            if (group.changed) noteContents(group);
    }

    struct GroupToWrite {
        const UniqueId& uid;
        int64_t number;
        const PendingMembership& changes;
        bool changed;
    };

    void takeOut(GroupToWrite& group) {
        for (const UniqueId& member : group.changes.removed)
            if (_store.removeListed(group.number, _store.rowNumber(member))) {
                group.changed = true;
                _log.note(member, CXDetailKind::left, group.uid);
            }
        for (const UniqueId& person : group.changes.choicesDropped) {
            for (const StoredChoice& choice : _store.choicesOfPerson(person))
                if (choice.record == group.uid) logChoice(person, group.uid, choice.property, choice.identifier);
            group.changed |= _store.removeChoices(group.number, _store.rowNumber(person));
        }
    }

    void putIn(GroupToWrite& group) {
        for (const UniqueId& member : group.changes.added)
            if (!member.empty()) group.changed |= addMember(group.uid, group.number, member);
        for (const auto& [person, chosen] : group.changes.choices)
            group.changed |= writeChoices(group.uid, group.number, person, chosen);
    }

    void noteContents(const GroupToWrite& group) {
        _store.setModified(group.number, _date);
        if (_noted.contains(group.uid)) return;
        const bool isCopy = cxIsSubscribed(group.uid);
        note(cxUIDWithTableName(group.uid, isCopy ? kCXSubscribedGroupContentsTable : kCXGroupContentsTable),
             CXChangeKind::updated);
    }

    bool addMember(const UniqueId& group, int64_t number, const UniqueId& member) {
        auto [row, kind] = _store.numberAndKind(member);
        if (row == 0) return false; // another process has removed it
        if (isGroup(kind) && _store.isReachable(row, number)) {
            CXLog("%@ cannot become a subgroup of %@, which another program has put below it; left out.", member,
                  group);
            return false;
        }
        if (!_store.addListed(number, row)) return false;
        _log.note(member, CXDetailKind::joined, group);
        return true;
    }

    bool writeChoices(const UniqueId& uid, int64_t group, const UniqueId& person,
                      const std::map<std::string, std::optional<std::string>>& chosen) {
        int64_t number = _store.rowNumber(person);
        if (number == 0) return false;
        bool changed = false;
        for (const auto& [property, identifier] : chosen) {
            const std::optional<std::string> before = _store.choice(uid, person, property);
            if (identifier ? !_store.setChoice(group, number, property, *identifier)
                           : !_store.removeChoice(group, number, property))
                continue;
            changed = true;
            logChoice(person, uid, property, before);
        }
        return changed;
    }

    RecordStore& _store;
    Journal& _journal;
    CommonVersions& _commonVersions;
    ConflictLog& _conflicts;
    FormerVersions& _formerVersions;
    ChangeLog& _log;
    const std::string& _identity;
    const std::string& _program;
    Date _date;
    const UnitOfWork* _work = nullptr;
    int64_t _save = 0;
    std::optional<bool> _areFormerKept;
    bool _keptFormer = false;
    std::set<UniqueId> _noted;
    std::set<std::string> _endedLocations; // of subscriptions that end with this save
};

} // namespace

void CXRolvane::Impl::requireSameFile() const {
    if (sqlite.hasMoved())
        throw CXException(kCXDatabaseException, "The contact database " + options.path +
                                                    " was moved away or replaced while this program had it open. "
                                                    "Start this program again.");
}

bool CXRolvane::Impl::save(const std::vector<CXExpected>& expected) {
    if (oneCommit || (work.empty() && expected.empty())) return true;
    return saveWith({}, expected);
}

CXRolvane::OneCommit::OneCommit(CXRolvane& rolvane) : _rolvane(rolvane) {
    std::lock_guard lock(_rolvane._impl->mutex);
    _rolvane._impl->oneCommit = true;
}

CXRolvane::OneCommit::~OneCommit() {
    std::lock_guard lock(_rolvane._impl->mutex);
    _rolvane._impl->oneCommit = false;
    _rolvane._impl->moveTo.reset();
}

void CXRolvane::OneCommit::commit(const PreferencesChanges& values) {
    std::lock_guard lock(_rolvane._impl->mutex);
    _rolvane._impl->saveWith(values, {});
}

bool CXRolvane::Impl::saveWith(const PreferencesChanges& values, const std::vector<CXExpected>& expected) {
    requireSameFile();
    const std::vector<Scanned> scansBefore = scans;
    bool changedRecords;
    try {
        SqliteTransaction transaction(sqlite);
        for (const auto& [uid, when] : expected) {
            const std::optional<StoredRow> row = store.row(uid);
            if (row ? row->modified != when : when.has_value()) return false;
        }
        Saver saver(*this, clock.now());
        saver.write(work);
        MemoryTable(sqlite).write(values);
        if (moveTo) advanceCursor(*moveTo);
        transaction.commit();
        changedRecords = saver.changedRecords();
    } catch (...) {
        scans = scansBefore;
        throw;
    }
    changeLog.wasCommitted();
    moveTo.reset();
    work.clear();
    store.noteOwnWrite();
    if (!changedRecords) return true;
    ChangeWatcher::touch(options.path);
    if (options.distributed)
        options.distributed->post({kCXDatabaseChangedDistributedNotification,
                                   std::nullopt,
                                   {{kCXDatabasePathKey, options.path},
                                    {kCXDatabaseIdentityKey, identity},
                                    {kCXSenderProcessID, static_cast<int64_t>(::getpid())}}});
    return true;
}

} // namespace rolvane
