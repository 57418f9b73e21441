#pragma once

#include "contacts/database/CommonVersions.h"
#include "contacts/database/ConflictLog.h"
#include "contacts/database/ReachedStore.h"
#include "contacts/records/CXAllGroup.h"
#include "contacts/records/CXGroup.h"
#include "contacts/records/CXPerson.h"
#include "contacts/records/CXSubscription.h"
#include "contacts/records/SearchText.h"
#include "foundation/Notification.h"
#include "foundation/Preferences.h"
#include "foundation/RunLoop.h"

#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace rolvane {

class SqliteSnapshot;

// One row, read without making a record object. Borrowed for the time of the call that it is handed to; copying is
// cheap.
struct CXRow {
    UniqueId uniqueId;
    UniqueId sharingUniqueId;
    RemoteLocation location; // empty for the owner's own
    Date created, modified;
    std::shared_ptr<const Bytes> encoded; // as CXRecord::encodedRepresentation
    std::string writer; // the program that wrote the properties last, this one where they are unsaved; "" if unknown
    std::vector<UniqueId> parentGroups; // people only: `uniqueId`s, oldest group first, without all-contacts groups
};

// One line of a list of people.
struct CXListing {
    UniqueId uniqueId;
    std::string displayName;
    RemoteLocation location;
};

enum class CXChangeKind { inserted, updated, deleted };

// One line of the journal.
struct CXJournalEntry {
    int64_t sequence;
    UniqueId uniqueId;
    CXChangeKind kind;
    int64_t processID;
    std::string program;
    Date date; // of the save; equal to the modification date that the save gave its records
};

// The state that a record is taken to be in when it is written.
struct CXExpected {
    UniqueId uniqueId;
    std::optional<Date> modified; // nothing: there is no such record
};

// The contact database: one SQLite file (WAL, synchronous=FULL, mode 0600, directory 0700), shared by all processes of
// a user. Unsaved changes live in this object's unit of work: every query of this process shows them, no other process
// does, and no lock is held for them. `save` writes them, the journal and the dates in one short transaction.
//
// Errors are CXException kCXDatabaseException with what happened, to which file, and what to do. A failed operation
// changes nothing; a failed save leaves every unsaved change in place, so that it can be tried again.
// Any thread: one lock guards all operations. Callbacks run outside of transactions, so they may use the database.
class CXRolvane {
public:
    struct Options {
        std::string path;             // "": dataDirectory()/contacts.db
        std::string program;          // "": the program's short name. Names this process's saves in the journal.
        const Clock* clock = nullptr; // null: Clock::system()
        NotificationCenter* center = nullptr;            // null: NotificationCenter::defaultCenter()
        DistributedNotifications* distributed = nullptr; // null: other processes hear of saves by the file watch alone
        RunLoop* runLoop = nullptr; // with one, this process watches for other processes' saves and has a cursor
        int busyTimeoutMilliseconds = 5000;
    };
    explicit CXRolvane(Options options); // opens or makes the file. All collaborators outlive the object.
    ~CXRolvane();                        // unsaved changes are dropped
    CXRolvane(const CXRolvane&) = delete;
    CXRolvane& operator=(const CXRolvane&) = delete;

    // The process's database, opened on first use with the configured options (or the defaults). One object, two names.
    static CXRolvane& sharedRolvane();
    static CXRolvane& sharedLocalRolvane();
    static void configureShared(Options options); // before first use; later it replaces (tests), ending the former one
    static void closeShared();

    // Records -----------------------------------------------------------------------------------------------------
    CXAllGroupRef allGroup();
    CXAllGroupRef allGroupForRemoteLocation(const RemoteLocation& location); // as CXAllGroup's
    std::vector<CXSubscriptionRef> subscriptions(); // the built-in one first, then oldest first
    CXSubscriptionRef findSubscriptionWithRemoteLocation(const RemoteLocation& location);
    // Any record by its exact `uniqueId`, CXGroupContents and CXInfo among them; null when there is none.
    CXRecordRef recordForUniqueId(const UniqueId& uid);
    // In order of modification date (unsaved ones last). All-contacts groups are never among them.
    std::vector<CXRecordRef> recordsMatchingSearchElement(const CXSearchElement& element);

    // Adds a record that belongs to no database. When a record of that identifier is here already, the handle becomes
    // one on it: a person's properties are replaced; a group keeps its members and what the new one says nothing of. A
    // subscription to a location that is subscribed already is refused with kCXInvalidArgumentException. A handle that
    // is here already: nothing.
    void addRecord(const CXRecordRef& record);
    // Removes the record with its memberships and distribution choices. Removing a subscription removes its location's
    // people, groups and all-contacts group in the same save. Refused with a log line and no effect: all-contacts
    // groups and the built-in subscription. A record that is not here: nothing. True when it was removed.
    bool removeRecord(const CXRecordRef& record);

    // Sets, without record objects ---------------------------------------------------------------------------------
    // People of the table ("CXPerson", "CXSubscribedPerson") modified after the date, by modification date, unsaved
    // ones last. Read in pages, so neither memory nor a transaction grows with the database.
    void forEachPersonModifiedSince(Date date, std::string_view table, const std::function<void(const CXRow&)>& call);
    // One row, null when there is none: a lookup by index.
    std::optional<CXRow> personRow(const UniqueId& uid);
    // Identifiers of all people of the table, oldest first: one query.
    std::vector<UniqueId> peopleOfTable(std::string_view table);
    // The rows of a group's members, in member order, in pages. What the callback changes in the membership may or may
    // not be seen.
    void forEachMember(const CXGroup& group, const std::function<void(const CXRow&)>& call);
    // People of one location (empty: the owner's own; nothing: all) in display order; with a text, only those whose
    // names, organisation, mails, phones or note contain it (letter case and accents do not matter).
    std::vector<CXListing> listPeople(const std::optional<RemoteLocation>& location, std::string_view text = {});
    // People of all locations in display order whose name is `named`, or has it in it, or whose identifier begins so;
    // letter case of ASCII aside. By indexes: fast whatever the size of the database.
    enum class Named { whole, part, byIdentifier };
    std::vector<CXListing> peopleNamed(const std::string& named, Named how);
    // Of the people whose name begins so, by name: the first ones and the last of all, not more than `most` (2 at
    // least). Of what is saved; by an index, so that it is as fast for many people as for few.
    std::vector<CXListing> peopleBegun(const std::string& start, size_t most);
    // People of all locations in display order who have all of these words (contacts/records/SearchText.h).
    std::vector<CXListing> peopleFound(const CXSearchQuery& query);
    // The rows of people, in this order, in pages. Those that are not here are passed over.
    void forEachOf(const std::vector<UniqueId>& uids, const std::function<void(const CXRow&)>& call);
    std::vector<CXListing> listGroups(const std::optional<RemoteLocation>& location); // by name
    size_t countPeople(const std::optional<RemoteLocation>& location);

    // While it lives, everything that this object reads is of one moment, that of the first reading: what other
    // processes save meanwhile does not show, and is not held up. Nothing may be saved with this object meanwhile.
    // Short lived, as the file grows with what others save.
    class OneMoment {
    public:
        explicit OneMoment(CXRolvane& rolvane);
        ~OneMoment();
        OneMoment(const OneMoment&) = delete;
        OneMoment& operator=(const OneMoment&) = delete;

    private:
        CXRolvane& _rolvane;
        std::unique_ptr<SqliteSnapshot> _snapshot;
    };

    // The unit of work -----------------------------------------------------------------------------------------------
    // Writes all unsaved changes in one transaction with one journal entry a record, then tells the other processes.
    // Nothing unsaved: nothing happens. An update of a record that another process has removed meanwhile is dropped;
    // other processes' changes to other properties of the same record are kept, of a person or a whole replacement
    // their changes to any (lists are merged). Of two processes that subscribe to one location at a time, the first
    // one's subscription stays. True always; throws on failure.
    bool save();
    // The same, where every one of these records is still as it is taken to be; looked at in the transaction. False,
    // with nothing written and the unsaved changes as they were, where one is not.
    bool saveIfStill(const std::vector<CXExpected>& expected);
    bool hasUnsavedChanges() const;
    size_t unsavedSize() const; // bytes of content that wait in memory for the save, roughly
    void rollback();            // drops the unsaved changes; handles of records that were only added become empty

    // While it lives, `save` and `advanceCursorTo` are only noted; `commit` carries them out in one transaction,
    // together with values of the table "daemon" (contacts/database/DaemonMemory.h), and is durable on return. Whether
    // it fails or is never called: nothing is written, and unsaved changes stay unsaved. One at a time, one thread.
    class OneCommit {
    public:
        explicit OneCommit(CXRolvane& rolvane);
        ~OneCommit();
        OneCommit(const OneCommit&) = delete;
        OneCommit& operator=(const OneCommit&) = delete;
        void commit(const PreferencesChanges& values);

    private:
        CXRolvane& _rolvane;
    };

    // Two people's edits of one contact ------------------------------------------------------------------------------
    // From the first edit of a contact that a store has had, until that edit is sent, the database keeps the contact as
    // both had it (contacts/records/ContactMerge.h merges against that). An edit is every save but one that says itself
    // what both have.
    //
    // Nothing: no store is known to have had the contact.
    std::optional<CXCommonVersion> commonVersion(const UniqueId& uid);
    // Both sides have had these encoded properties. Part of the unit of work. Any thread.
    void setCommonVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties);
    // These encoded properties are going to be written to a store, which may have them from then on until a common
    // version is set, whatever becomes of the process. Part of the unit of work. Any thread.
    void setSentVersion(const UniqueId& uid, std::shared_ptr<const Bytes> properties);
    std::vector<UniqueId> editedSinceCommon(); // contacts with edits that were not sent, oldest first
    // New records that a store has now, or names in its lists, whatever becomes of the pass that put them there.
    // Durable on return; of records that are saved. Any thread.
    void noteReachedAtOnce(const std::vector<CXReached>& reached);
    std::vector<CXReached> reached();
    void forgetReached(const std::vector<UniqueId>& records); // durable on return
    // Values that gave way to others: noted with the next save, or durably on return.
    void noteConflicts(const UniqueId& uid, const std::vector<CXMergeConflict>& conflicts);
    void noteConflictsAtOnce(const UniqueId& uid, const std::vector<CXMergeConflict>& conflicts); // any thread
    std::vector<CXConflict> conflicts(); // those that are saved, oldest first
    std::optional<CXConflict> conflict(int64_t number);
    bool forgetConflict(int64_t number); // durable on return; false when there is none

    // From the first call on, every program that saves an edit of a person or a group keeps what its properties were
    // before (of 1,000 edits). Durable on return.
    void keepFormerVersions();
    // The encoded properties of that time; null when they are the present ones or not known.
    std::shared_ptr<const Bytes> formerVersion(const UniqueId& uid, Date at);

    // Identity and share count -----------------------------------------------------------------------------------
    // Made with the file, kept through everything but a new file.
    std::string databaseIdentity() const;
    // Changes only by setShareCount; part of the unit of work like a property.
    int64_t shareCount();
    void setShareCount(int64_t count);
    // Where the database is in its history, to be kept elsewhere, and whether it has gone on from there: false for
    // another database, and for an earlier copy of this one.
    Dictionary historyMark();
    bool isOfHistory(const Dictionary& mark);

    // Other processes' saves -------------------------------------------------------------------------------------
    // With a run loop, a waking (bus signal or file watch) calls deliverExternalChanges from the loop by itself.
    //
    // This program's cursor says up to where it has taken the journal; it is kept in the database under the program's
    // name and outlives the process. It starts at the journal's end when the program first watches the database.
    // Entries written by any process of the same program are this program's own and are never delivered.
    //
    // Reads the journal behind the cursor, joins all waiting saves into one notification, posts it on the notification
    // centre and, when the observers have returned, commits the cursor: a crash before that delivers again, so nothing
    // is lost. True when something was posted. Not re-entrant: called from an observer it does nothing (false), and
    // what came meanwhile is delivered by the next call or waking. An exception of an observer leaves the cursor.
    bool deliverExternalChanges();
    bool hasExternalChanges(); // would deliverExternalChanges post?
    // The journal's end. A full scan takes it before it starts.
    int64_t journalPosition();
    int64_t cursorPosition();
    // Another program's cursor, to see how far it has come; -1 when it has never watched this database.
    int64_t cursorPosition(const std::string& program);
    // After a pass whose full scan read everything modified after `scannedSince` and compared all groups: moves the
    // cursor to the position taken before that scan, so that what was captured is not delivered once more. Entries of
    // saves dated at or before `scannedSince` were not captured (they were saved while an earlier pass ended): the
    // cursor stops in front of the first of them and they are delivered, without those behind it that were captured
    // (a new process delivers all). Never moves backwards. Durable on return.
    void advanceCursorTo(int64_t position, Date scannedSince);
    // The records that other programs have saved behind one position of the journal, up to another.
    std::vector<UniqueId> changedByOthers(int64_t after, int64_t until);
    std::vector<CXJournalEntry> journalEntries(int64_t after, size_t limit = 1000);

    const std::string& path() const;
    bool isOfPast() const; // another file has its path by now, or none: nothing can be saved any more
    const std::string& programName() const;

    struct Impl; // the framework's own; see RolvaneImpl.h
    Impl& impl() { return *_impl; }

private:
    std::unique_ptr<Impl> _impl;
};

} // namespace rolvane
