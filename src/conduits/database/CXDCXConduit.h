#pragma once

#include "conduits/CXDConduit.h"
#include "foundation/Notification.h"

#include <memory>
#include <optional>
#include <string>
#include <unistd.h>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace rolvane {

class CXGroup;
class CXMultiValue;
class CXPerson;
class CXSubscription;
class CXRecord;
class CXRolvane;
class ChangeCapture;
class RemovalChanges;
class Clock;
class Preferences;

// The conduit of the owner's contact database: turns what happens there into change records. Main thread only.
//
// Records of other sources are applied in CXDCXConduitApplying.cpp.
//
// What it never does is see the daemon's own writes as somebody's edits: it hears only of other processes' saves, drops
// a notification whose sender is this process, and compares against a prior state that the engine keeps up to date as
// records are applied.
//
// A full scan and the journal of saves divide the work like this: the scan notes the journal's end, reads the database
// as it is at that moment, and when the pass has stored what the scan captured, `close` moves the journal's cursor
// there. A save that comes while the scan or the pass runs lies behind that mark and is delivered after the pass,
// however the two dates compare.
class CXDCXConduit : public CXDConduit {
public:
    static constexpr const char* kLastSyncDateKey = "CXDCXConduitLastSyncDate";

    // All borrowed; they outlive the conduit.
    struct Collaborators {
        CXRolvane& rolvane;
        Preferences& preferences;
        Clock& clock;
        NotificationCenter& notifications; // this process's: the framework posts other processes' saves here
        pid_t processID = getpid();        // whose saves are this daemon's own
        std::string program{};             // the same for earlier runs; "": the database's program name
    };

    CXDCXConduit(ConduitEngine& engine, Collaborators with);
    ~CXDCXConduit() override;

    std::optional<std::string> conduitID() const override;
    int32_t conduitSource() const override;
    // Writes one record from another source into the database, through the handler of its type. False for composite
    // group changes, distribution-list removals and unknown types, which nothing here carries out; true for every other
    // record, what it names being gone included. Never denies. While the kill switch is on, a record of the owner's own
    // user is logged and swallowed. Nothing is saved before the pass ends, but for new groups and where more than 32 MB
    // would wait.
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) override;

    // The handlers, each true on every path. Identifiers come in either form, shared or subscribed. They change only
    // what belongs to the record's user: another user's record never reaches the owner's own people and groups, nor the
    // copies of a third user. Kinds are checked too: what a member list calls a person and is none stays as it is.
    bool updateRecord(const CXDChangeRecordPtr& record);
    bool createStructureForGroup(const CXDChangeRecordPtr& record); // saves
    bool changeGroupName(const CXDChangeRecordPtr& record);
    bool addRecordToGroup(const CXDChangeRecordPtr& record);
    bool addGroupToGroup(const CXDChangeRecordPtr& record);
    bool removeRecordFromGroup(const CXDChangeRecordPtr& record);
    bool removeGroupFromGroup(const CXDChangeRecordPtr& record);
    bool deleteRecord(const CXDChangeRecordPtr& record);
    bool deleteGroup(const CXDChangeRecordPtr& record); // the all-contacts group too; the database refuses that
    bool changeGroupReadACL(const CXDChangeRecordPtr& record);
    bool changeGroupReadWriteACL(const CXDChangeRecordPtr& record); // the manager's `save` writes it
    bool updateDistributionList(const CXDChangeRecordPtr& record);
    // The manager that the base finds, else a new one, kept under the URL's own text.
    std::shared_ptr<CXACLManager> ACLManagerForRemoteLocation(const Url& location) override;

    // A person or group that was put into a group is looked for: its content may not have come, and no group is put
    // below itself. The same for choices that were made for a person in a group.
    bool holds(const CXDChangeRecord& record) override;
    // A nesting that would be a circle: of groups that were turned round the former nesting is taken back later.
    bool waitsForWhatFollows(const CXDChangeRecord& record) override;
    bool swallows(const CXDChangeRecord& record) const override; // by the kill switch

    void open() override;
    // Saves the database, forgets revoked users, moves the last-sync date to now and, after a full scan, the journal's
    // cursor behind what the scan captured.
    void close() override;
    // The full scan: groups and people modified after the last sync, then every all-contacts group whatever the dates.
    // People whom the daemon itself wrote last are left out: a pass that was cut off before it could move the last-sync
    // date has their data from a store, where something newer may stand by now.
    CXDChangeRecords changeRecords() override;

    // The comparison that a scan makes of one group.
    std::optional<CXDChangeRecords> changesOfGroupNow(const UniqueId& group) override;

    // Another process has saved. Hands the records to the engine in one trickle pass.
    void rolvaneChanged(const Notification& notification);

    CXDChangeRecords changesForPerson(const std::shared_ptr<CXPerson>& person, bool update);
    CXDChangeRecords changesForGroup(const std::shared_ptr<CXGroup>& group); // none gives none
    CXDChangeRecords compareGroupPriorStateToCurrentState(const Value& prior, const Value& current,
                                                          const UniqueId& guid, const RemoteLocation& location);
    CXDChangeRecords compareDistributionPriorStateToCurrentState(const Value& prior, const Value& current,
                                                                 const UniqueId& guid, const UserName& user,
                                                                 int32_t sources);
    Dictionary currentDistributionListStateForGroup(const std::shared_ptr<CXGroup>& group);
    CXDChangeRecords distributionListChangesForPerson(const std::shared_ptr<CXPerson>& person, int32_t sources,
                                                      const UserName& user);
    CXDChangeRecords changesToRemovePerson(const UniqueId& person);
    CXDChangeRecords changesToRemoveGroup(const UniqueId& group);
    CXDChangeRecords generateChangeRecordsToRevokeGroupUID(const UniqueId& group);

    // A normalised identifier finds the subscribed copy of a record before the plain one; null when there is neither.
    std::shared_ptr<CXRecord> recordForUniqueId(const UniqueId& uid);
    void lookForRevokedSubscriptions(const std::vector<UniqueId>& deleted);
    int32_t sourcesFromRemoteLocations(const CXMultiValue& locations) const;

    // Set once: nobody holds read-write access to the owner's own data, so a change to it from outside is bogus.
    void setKillSwitch();
    bool readOnlyKillSwitch() const { return _readOnlyKillSwitch; }
    CXRolvane& rolvane() const { return _with.rolvane; }

private:
    // What a full scan of this pass has covered: saves up to the journal's position, modified after the date.
    struct Scan {
        int64_t journalPosition;
        Date since;
    };

    // All that a scan of the all-contacts groups looks at. Equal ones find the same, and edits of people alone.
    struct Moment {
        int64_t journal = 0;
        uint64_t states = 0;
        bool operator==(const Moment&) const = default;
    };

    Dictionary priorState() const;
    ChangeCapture newCapture() const;
    bool forgetWhatIsPublishedAgain(); // true: there is something
    // A writer's change of the owner's lists is none; that of another computer of the owner is.
    void changeOwnList(const CXDChangeRecord& record, const char* property);
    bool saysSomething(const CXSubscription& subscription) const;
    void addAllGroups(ChangeCapture& capture);
    void addGroupsOfTheJournal(ChangeCapture& capture, const Scan& scan, std::unordered_set<UniqueId> added);
    void addUnsettledGroups(ChangeCapture& capture);
    void addUnsettledPeople(ChangeCapture& capture);
    const std::string& ownProgram() const;
    bool dispatch(const CXDChangeRecordPtr& record);
    // What the record names, where it is there, of the right kind and the record's to change; else null.
    std::shared_ptr<CXPerson> personOf(const CXDChangeRecord& record);
    std::shared_ptr<CXGroup> groupOf(const CXDChangeRecord& record);
    std::shared_ptr<CXGroup> subgroupOf(const CXDChangeRecord& record);
    void takeIn(const CXDChangeRecord& record, CXPerson& person, const Dictionary& content);
    bool mayChange(const CXDChangeRecord& record, const CXRecord& found);
    // Has somebody else saved the record since this pass gathered its changes? That edit is still to be captured.
    bool hasUncapturedEdit(const UniqueId& uid);
    bool isRenamedHere(const CXDChangeRecord& record, const CXGroup& group);
    void captureInserted(ChangeCapture& capture, const Array& identifiers);
    void captureReplaced(ChangeCapture& capture, const Array& inserted);
    void captureUpdated(ChangeCapture& capture, const Array& identifiers);
    void captureDeleted(ChangeCapture& capture, const Array& identifiers);
    void captureWhatListed(ChangeCapture& capture, const RemovalChanges& removals, const UniqueId& uid);

    Collaborators _with;
    bool _readOnlyKillSwitch = false;
    bool _isOneOfSeveral = false; // other computers of the owner write to the tree; as of the last open
    bool _takesIn = false;        // this pass takes the owner's tree in, and has scanned nothing
    std::optional<Scan> _scan;
    std::optional<Moment> _foundNothing;      // of the last scan, if so
    int64_t _lastScan = 0;                    // the journal's position at the scan of the pass before, in this process
    int64_t _captured = 0;                    // the journal's position when this pass gathered, and
    int64_t _editsKnown = 0;                  // the one up to which
    std::unordered_set<UniqueId> _uncaptured; // holds what others have saved since
    std::unordered_map<RemoteLocation, UserName> _publishers; // whose the locations are, as far as asked
    std::unordered_set<UniqueId> _written;                    // people of this pass
    ObservationHandle _databaseChanged;
};

} // namespace rolvane
