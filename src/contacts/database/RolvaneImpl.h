#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/database/ChangeLog.h"
#include "contacts/database/ChangeWatcher.h"
#include "contacts/database/CommonVersions.h"
#include "contacts/database/ConflictLog.h"
#include "contacts/database/FormerVersions.h"
#include "contacts/database/Journal.h"
#include "contacts/database/ReachedStore.h"
#include "contacts/database/RecordStore.h"
#include "contacts/database/SharedForms.h"
#include "contacts/database/UnitOfWork.h"

#include <mutex>
#include <unordered_map>

namespace rolvane {

// The inside of CXRolvane, for the files of this room alone: what is stored with the unit of work laid over it. The
// record classes lock `mutex` and then call these. Everything but the constructor wants the lock.
struct CXRolvane::Impl {
    Impl(CXRolvane& owner, Options given);

    CXRolvane& face;
    Options options; // with path and program filled in
    const Clock& clock;
    NotificationCenter& center;
    mutable std::recursive_mutex mutex;
    Sqlite sqlite;
    RecordStore store;
    Journal journal;
    CommonVersions commonVersions;
    ReachedStore reachedStore;
    ConflictLog conflicts;
    FormerVersions formerVersions;
    ChangeLog changeLog;
    UnitOfWork work;
    std::string identity;
    std::shared_ptr<CXRolvane* const> anchor; // handles hold it weakly
    bool delivering = false;
    // Up to the position, what is dated later was captured by a scan, though the cursor could not pass it.
    struct Scanned {
        int64_t position;
        Date since;
    };
    std::vector<Scanned> scans;    // ahead of the cursor
    bool oneCommit = false;        // a OneCommit lives
    std::optional<Scanned> moveTo; // of the cursor, with that commit
    std::unique_ptr<ChangeWatcher> watcher;

    // CXException when the path names another file by now: what is read is of the past, what is saved would be lost.
    void requireSameFile() const;
    // What every database has cannot be found.
    [[noreturn]] void isMissing(const std::string& what);

    // Handles
    CXRecordRef handle(const UniqueId& uid); // null when there is no such record
    template <class T>
    std::shared_ptr<T> handleAs(const UniqueId& uid) {
        return std::dynamic_pointer_cast<T>(handle(uid));
    }
    void adopt(const CXRecordRef& record); // a record of its own becomes the handle of its identifier

    // Reading through the unit of work
    RecordKind kind(const UniqueId& uid); // none when there is no such record
    const std::optional<StoredRow>& storedRow(const UniqueId& uid);
    const Dictionary& storedProperties(const UniqueId& uid); // not to be changed; empty when there is no row
    Dictionary properties(const UniqueId& uid);              // top level is new; containers inside may be shared
    Value property(const UniqueId& uid, std::string_view name);
    std::shared_ptr<const Bytes> encoded(const UniqueId& uid);
    std::string location(const UniqueId& uid);
    Date modified(const UniqueId& uid);
    std::optional<CXRow> row(const UniqueId& uid, bool withParents);
    std::vector<UniqueId> recordsOf(RecordKind kind, const std::optional<std::string>& location);
    std::vector<UniqueId> sharedFormsOf(RecordKind people, const std::optional<std::string>& location,
                                        SharedForms& forms);
    size_t countOf(RecordKind kind, const std::optional<std::string>& location);
    std::vector<UniqueId> listed(const UniqueId& group, bool groups);
    bool isListed(const UniqueId& group, const UniqueId& member);
    std::vector<UniqueId> parents(const UniqueId& member);
    std::optional<std::string> choice(const UniqueId& group, const UniqueId& person, const std::string& property);
    std::map<UniqueId, CXDistributionChoices> choicesOfGroup(const UniqueId& group);
    std::map<UniqueId, CXDistributionChoices> choicesOfPerson(const UniqueId& person);

    // Changing the unit of work
    bool setProperty(const UniqueId& uid, std::string_view name, Value value);
    void replaceProperties(const UniqueId& uid, Dictionary properties);
    void insert(const UniqueId& uid, RecordKind kind, const Dictionary& properties);
    bool remove(const UniqueId& uid);
    bool list(const UniqueId& group, const UniqueId& member);
    bool unlist(const UniqueId& group, const UniqueId& member);
    void setChoice(const UniqueId& group, const UniqueId& person, const std::string& property,
                   const std::optional<std::string>& identifier);
    bool save(const std::vector<CXExpected>& expected = {}); // false: a record is not as expected
    bool saveWith(const PreferencesChanges& values, const std::vector<CXExpected>& expected);

    int64_t cursor(); // registers the program's cursor when there is none
    void advanceCursor(const Scanned& scan);

private:
    PendingRecord& pending(const UniqueId& uid);
    CXRecord* makeHandle(const UniqueId& uid, RecordKind kind);

    std::unordered_map<UniqueId, std::weak_ptr<CXRecord>> _handles;
    size_t _handleLimit = 1024; // when to look for dead ones
    struct CachedRow {
        std::optional<StoredRow> row;
        std::optional<Dictionary> decoded;
    };
    CachedRow& cached(const UniqueId& uid);
    using StoredList = std::vector<std::pair<UniqueId, RecordKind>>;
    const StoredList& storedList(const UniqueId& group); // kept, since who asks for members asks for subgroups next
    StoredList _list;
    UniqueId _listedGroup;
    uint64_t _listGeneration = 0;
    std::unordered_map<UniqueId, CachedRow> _rows; // as of `_rowsGeneration`
    uint64_t _rowsGeneration = 0;
};

RecordKind kindOfRecord(const CXRecord& record); // of its class

// True for the properties that the database keeps itself.
bool isKeptByDatabase(std::string_view property);
// May a record of the kind have the property set so? (A group's name cannot be taken away.)
bool mayHave(RecordKind kind, std::string_view property, const Value& value);

} // namespace rolvane
