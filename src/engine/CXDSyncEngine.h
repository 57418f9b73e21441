#pragma once

#include "conduits/ConduitEngine.h"
#include "engine/EngineCollaborators.h"
#include "engine/IdleExit.h"
#include "model/RemoteLocationMap.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXMerger;
struct EngineParts;

// The daemon's centre: owns the conduits, the memory, the queue and the locks, and runs the passes. This is the face
// that other rooms see; each subject is a class of its own beside it.
//
// Main thread, but for what ConduitEngine marks otherwise, `requestTermination` and `failedToGetPassword`. A pass runs
// to its end on the main thread and never inside another one: a pass that is asked for meanwhile runs when the current
// event is over.
//
// An edit that another process saves while a pass runs waits in the database's journal and is delivered when the run
// loop turns again. Before the idle-exit timer ends the process it delivers what waits there, so with an interval of 0
// everything saved before the last look at the journal has been through a pass; what is saved later is found by the
// next process, whose first pass scans the database.
class CXDSyncEngine final : public ConduitEngine, public RecordLocator {
public:
    // init. May end the process: when nothing is shared any more.
    explicit CXDSyncEngine(const EngineCollaborators& collaborators);
    ~CXDSyncEngine() override;
    CXDSyncEngine(const CXDSyncEngine&) = delete;
    CXDSyncEngine& operator=(const CXDSyncEngine&) = delete;

    // The process's engine, made on the first call by the maker that was given before; kept for the process's life.
    static CXDSyncEngine& sharedSyncEngine();
    static CXDSyncEngine* sharedSyncEngineIfMade();
    using Maker = std::function<std::unique_ptr<CXDSyncEngine>()>;
    static void setMaker(Maker maker); // also drops the shared engine (tests)
    // Starts the countdown of the process's idle exit anew; with IdleExit::kNever nothing, not even an engine.
    static void persist();
    static std::string cxdPath(); // of the executable

    // Passes.
    void bringSourcesUpToDate() override;
    void bringSourcesUpToDateAndDoNotTryAgain();
    void bringSourcesUpToDateAndAllowRetry(bool allowRetry);
    void applyChangeRecords(const CXDChangeRecords& records) override;
    void applyChangeRecords(const CXDChangeRecords& records, bool trickle);
    void applyChangeRecords(CXDChangeRecords records, bool trickle, bool allowRetry);
    void cxdSubscribed(const Notification& notification);
    void cxdAllACLChanged(const Notification& notification);
    void cxdPublishedAll(const Notification& notification);
    void cxdSynced(const Notification& notification); // not when it comes from the login user

    // State.
    Dictionary conduitData();
    Dictionary conduitObjectForKey(const std::string& conduitID, const std::string& key) override;
    void setConduitObjectForKey(const std::string& conduitID, const Value& object, const std::string& key) override;
    Dictionary knownGroupState(const std::string& conduitID, const UserName& user, const UniqueId& group) override;
    std::optional<uint64_t> stateGeneration() override;
    void syncPrefs() override;
    void saveInThePass() override;
    CXDChangeRecords getPendingChanges() const;
    bool hasPendingChanges(const UserName& user, int32_t source) override;
    void setPendingChanges(const CXDChangeRecords& records);
    void setRemoteLocationForSubscriptionUID(const std::optional<RemoteLocation>& location,
                                             const std::optional<UniqueId>& subscription) override;
    std::optional<RemoteLocation> remoteLocationForSubscriptionUID(const UniqueId& subscription) const override;
    void removeSubscriptionMapForRemoteLocation(const RemoteLocation& location);
    void saveACLs();
    void reset();
    void checkCXShareCount() override;
    void updateStateAndExitIfNeeded() override;
    void removeCacheDataForConduit(CXDConduit& conduit);
    CXDConduit* conduitForSyncSource(int32_t source) override;

    // Conflicts, cache, locks, revocation.
    void noteRefused(const Refusal& refusal) override;
    void storeWasTested(bool reached, int error, const std::string& reason) override;
    void treeWasLookedAt(const UserName& user, TreeLook how) override;
    bool shouldChangeRecordBeCanceled(const CXDChangeRecord& record) const override;
    void cancelPendingChangesLike(const CXDChangeRecordPtr& denied, const CXDChangeRecords& amongst);
    Dictionary payloadMerging(const Dictionary& first, const Dictionary& into);
    CXDChangeRecordPtr mingleChange(const CXDChangeRecordPtr& record, CXDChangeRecords& amongstChanges);
    void didApplyChange(const CXDChangeRecordPtr& record, int32_t toSource);
    int32_t sourcesForGUID(const UniqueId& group) override;
    bool isGUIDPublished(const UniqueId& group);
    void removeGUID(const UniqueId& group);
    bool lockURL(const Url& url) override;
    void unlockAllURLs();
    bool isRevoked(const RemoteLocation& location) const override;
    std::vector<RemoteLocation> revokedRemoteLocations() const override;
    void revokeRemoteLocation(const RemoteLocation& location, const std::optional<UniqueId>& subscription) override;

    // Locations. A location that no conduit serves ends the process.
    UserName userForRemoteLocation(const RemoteLocation& location) const override;
    std::optional<RemoteLocation> baseLocation(int32_t source, const std::optional<UserName>& user) const override;

    // Ending.
    void cancel() override;
    void failedToGetPassword(); // any thread
    [[noreturn]] void killCXD() const;
    // Any thread: the pass that runs applies nothing more, keeps what is left as pending and ends the process. When no
    // pass runs nothing happens before the next one; whoever asks on the main thread calls killCXD then.
    void requestTermination();
    bool terminationRequested() const;
    bool passRunning() const { return _passRunning; } // main thread

private:
    struct PassKind {
        bool full = false;  // it gathers
        bool retry = false; // of one that was refused something
    };
    void armIdleExit();
    void idleExit();
    CXDChangeRecords gather();
    void apply(CXDChangeRecords records, bool trickle, bool allowRetry);
    void scheduleRetry();
    void makePass(bool allowRetry, bool isRetry);
    // Runs it now, or when the current event is over if a pass is running; not at all when the process is ending.
    void runPass(PassKind kind, std::function<void()> pass);
    void performLater(std::function<void()> call);

    std::unique_ptr<EngineParts> _parts;
    std::unique_ptr<CXMerger> _merger;
    std::shared_ptr<bool> _alive = std::make_shared<bool>(true); // for calls that wait on the run loop
    std::vector<ObservationHandle> _observations;
    bool _passRunning = false;
};

} // namespace rolvane
