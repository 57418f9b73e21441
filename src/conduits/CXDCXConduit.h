#pragma once

#include "conduits/CXDConduit.h"
#include "foundation/Notification.h"

#include <memory>
#include <optional>
#include <string>
#include <unistd.h>
#include <vector>

namespace rolvane {

class CXGroup;
class CXMultiValue;
class CXPerson;
class CXRecord;
class CXRolvane;
class ChangeCapture;
class Clock;
class Preferences;

// The conduit of the owner's contact database: turns what happens there into change records. Main thread only.
//
// What it never does is see the daemon's own writes as somebody's edits: it hears only of other processes' saves, drops
// a notification whose sender is this process, and compares against a prior state that the engine keeps up to date as
// records are applied.
//
// A full scan and the journal of saves divide the work like this: the scan notes the journal's end before it reads, and
// when the pass has stored what the scan captured, `close` moves the journal's cursor there. A save that comes while
// the scan or the pass runs lies behind that mark and is delivered after the pass, however the two dates compare.
class CXDCXConduit : public CXDConduit {
public:
    static constexpr const char* kLastSyncDateKey = "CXDCXConduitLastSyncDate";

    // All borrowed; they outlive the conduit.
    struct World {
        CXRolvane& rolvane;
        Preferences& preferences;
        Clock& clock;
        NotificationCenter& notifications; // this process's: the framework posts other processes' saves here
        pid_t processID = getpid();        // whose saves are this daemon's own
    };

    CXDCXConduit(ConduitEngine& engine, World world);
    ~CXDCXConduit() override;

    std::optional<std::string> conduitID() const override;
    int32_t conduitSource() const override;
    // Applies no record of any type yet: false, and the record stays with the engine.
    using CXDConduit::applyChangeRecord;
    bool applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) override;

    void open() override;
    // Saves the database, forgets revoked users, moves the last-sync date to now and, after a full scan, the journal's
    // cursor behind what the scan captured.
    void close() override;
    // The full scan: groups and people modified after the last sync, then every all-contacts group whatever the dates.
    CXDChangeRecords changeRecords() override;

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
    CXRolvane& rolvane() const { return _world.rolvane; }

private:
    // What a full scan of this pass has covered: saves up to the journal's position, modified after the date.
    struct Scan {
        int64_t journalPosition;
        Date since;
    };

    Dictionary priorState() const;
    void captureInserted(ChangeCapture& capture, const Array& identifiers);
    void captureUpdated(ChangeCapture& capture, const Array& identifiers);
    void captureDeleted(ChangeCapture& capture, const Array& identifiers);

    World _world;
    bool _readOnlyKillSwitch = false;
    std::optional<Scan> _scan;
    ObservationHandle _databaseChanged;
};

} // namespace rolvane
