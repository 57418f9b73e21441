#include "engine/CXDSyncEngine.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/records/CXMerger.h"
#include "engine/EngineParts.h"
#include "engine/memory/PriorStates.h"
#include "engine/pass/ApplyLoop.h"
#include "engine/queue/PayloadMerging.h"
#include "engine/queue/RefusedChanges.h"
#include "engine/recovery/DatabaseCare.h"
#include "foundation/CXException.h"
#include "foundation/FreeMemory.h"
#include "foundation/Log.h"
#include "model/PayloadKeys.h"

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <utility>

namespace rolvane {

namespace {

constexpr const char* kStartedSyncing = "CXDStartedSyncingNotification";
constexpr const char* kSubscriptionListChanged = "CXSubscriptionListChanged";
constexpr const char* kAllACLChanged = "CXAllACLChanged";

struct Shared {
    CXDSyncEngine::Maker make;
    std::unique_ptr<CXDSyncEngine> engine;
};
Shared& shared() {
    // Never destroyed: the engine lives for the process, and its collaborators may be gone before the last statics.
    static Shared* const instance = new Shared;
    return *instance;
}

void append(CXDChangeRecords& to, CXDChangeRecords&& from) {
    to.insert(to.end(), std::make_move_iterator(from.begin()), std::make_move_iterator(from.end()));
}

} // namespace

// -- the engine

CXDSyncEngine::CXDSyncEngine(const EngineCollaborators& collaborators)
    : _parts(std::make_unique<EngineParts>(collaborators)) {
    _parts->with.account.setFailedPasswordHandler([this] { failedToGetPassword(); });
    _parts->conduits = _parts->with.makeConduits(*this);
    updateStateAndExitIfNeeded();
    _parts->with.account.updateConfigDataIfNeeded();
    _parts->locks.startRenewing();
    _merger = std::make_unique<CXMerger>();
    DistributedNotifications& distributed = _parts->with.distributed;
    _observations.push_back(distributed.observe(
        kSubscriptionListChanged, [this](const Notification& n) { cxdSubscribed(n); }, true));
    _observations.push_back(distributed.observe(
        kAllACLChanged, [this](const Notification& n) { cxdAllACLChanged(n); }, true));
}

CXDSyncEngine::~CXDSyncEngine() {
    _parts->with.account.setFailedPasswordHandler({});
    _parts->with.idleExit.disarm(); // its timer calls this object
}

CXDSyncEngine& CXDSyncEngine::sharedSyncEngine() {
    if (!shared().engine) {
        if (!shared().make)
            throw CXException(kCXInvalidArgumentException, "The sync engine is asked for before it can be made.");
        shared().engine = shared().make();
    }
    return *shared().engine;
}

CXDSyncEngine* CXDSyncEngine::sharedSyncEngineIfMade() {
    return shared().engine.get();
}

void CXDSyncEngine::setMaker(Maker maker) {
    shared().engine.reset();
    shared().make = std::move(maker);
}

void CXDSyncEngine::persist() {
    if (IdleExit::process().interval() != IdleExit::kNever) sharedSyncEngine().armIdleExit();
}

std::string CXDSyncEngine::cxdPath() {
    std::error_code error;
    return std::filesystem::read_symlink("/proc/self/exe", error).string();
}

// -- idle exit and ending

void CXDSyncEngine::armIdleExit() {
    _parts->with.idleExit.arm(_parts->with.runLoop, [this] { idleExit(); });
}

// What waits is served first: a retry that a pass has scheduled, and what other processes saved meanwhile. Each ends in
// a pass or arms the timer again, so nothing is left waiting for ever and nothing keeps the process for ever.
void CXDSyncEngine::idleExit() {
    if (_parts->retryScheduled) return armIdleExit();
    try {
        if (!terminationRequested() && _parts->with.rolvane.deliverExternalChanges()) return armIdleExit();
    } catch (const CXException& e) {
        CXLog("Changes that wait in the database are left for the next start: %@", e);
    }
    killCXD();
}

void CXDSyncEngine::cancel() {
    _parts->with.progress.stop();
    killCXD();
}

void CXDSyncEngine::failedToGetPassword() {
    cancel();
}

void CXDSyncEngine::killCXD() const {
    rolvane::killCXD(*_parts);
}

void CXDSyncEngine::requestTermination() {
    _parts->terminating = true;
}

bool CXDSyncEngine::terminationRequested() const {
    return _parts->terminating;
}

// -- passes

void CXDSyncEngine::performLater(std::function<void()> call) {
    _parts->with.runLoop.performAfterDelay(0, [alive = std::weak_ptr<bool>(_alive), call = std::move(call)] {
        if (!alive.expired()) call();
    });
}

void CXDSyncEngine::runPass(PassKind kind, std::function<void()> pass) {
    if (_parts->ending) return;
    if (_passRunning) {
        ++_parts->passesAskedFor;
        return performLater([this, kind, pass = std::move(pass)] {
            --_parts->passesAskedFor;
            runPass(kind, pass);
        });
    }
    struct Running {
        bool& flag;
        explicit Running(bool& f) : flag(f) { flag = true; }
        ~Running() { flag = false; }
    };
    {
        const Running running(_passRunning);
        _parts->outcomes.begin(kind.full, kind.retry);
        try {
            // What cannot be believed is not told to anybody. Whoever delivers changes must not take them for done.
            if (mendDatabase(*_parts))
                pass();
            else if (!kind.full)
                throw CXDamagedDatabase("The changes wait until the contact database is in order.");
            meetsDamage(*_parts);
        } catch (const CXException& e) {
            meetsDamage(*_parts);
            _parts->outcomes.caught(e.reason());
            endPass(*_parts);
            throw;
        }
        endPass(*_parts);
    }
    if (terminationRequested()) killCXD();
}

void CXDSyncEngine::scheduleRetry() {
    _parts->retryScheduled = true;
    performLater([this] {
        _parts->retryScheduled = false;
        makePass(false, true);
    });
}

void CXDSyncEngine::bringSourcesUpToDate() {
    bringSourcesUpToDateAndAllowRetry(true);
}

void CXDSyncEngine::bringSourcesUpToDateAndDoNotTryAgain() {
    bringSourcesUpToDateAndAllowRetry(false);
}

void CXDSyncEngine::bringSourcesUpToDateAndAllowRetry(bool allowRetry) {
    makePass(allowRetry, false);
}

void CXDSyncEngine::makePass(bool allowRetry, bool isRetry) {
    runPass({true, isRetry}, [this, allowRetry] {
        _parts->with.distributed.post({kStartedSyncing, std::nullopt, {}});
        checkCXShareCount();
        _parts->state.dropConduitData();
        _parts->state.conduitData();
        _parts->marksOfThePass = _parts->state.marks();
        // What was revoked before is forgotten already; what is subscribed to again is not revoked.
        _parts->revoked.clear();
        forgetFormerSubscriptions(*_parts);
        _parts->with.progress.startedPhase(1);
        CXDChangeRecords gathered = gather();
        if (!damageOf(_parts->with.rolvane).empty()) { // what was gathered may name as gone what is there
            _parts->with.progress.stop();
            if (allowRetry) scheduleRetry(); // which begins with a repair
            return;
        }
        // Nothing has been changed yet, and the next process finds the same again.
        if (terminationRequested()) {
            unlockAllURLs();
            killCXD();
        }
        apply(std::move(gathered), false, allowRetry);
        _parts->with.progress.stop();
        returnFreeMemory();
    });
}

CXDChangeRecords CXDSyncEngine::gather() {
    EngineConduits& conduits = _parts->conduits;
    CXDChangeRecords gathered;
    try {
        conduits.vaultra->willGather();
        conduits.cx->open();
        conduits.vaultra->open();
        forgetFormerSubscriptions(*_parts); // opening takes its time, and the scan must not meet their absence
        append(gathered, conduits.cx->changeRecords());
        if (_parts->with.releaseLocksOfEndedRuns && !_parts->vaultraOffLine()) _parts->with.releaseLocksOfEndedRuns();
        if (!_parts->vaultraOffLine()) append(gathered, conduits.vaultra->changeRecords());
    } catch (const CXException& e) {
        CXLog("bringSourcesUpToDate: Caught %@: %@", e.name(), e.reason());
        _parts->outcomes.caught(e.reason());
        unlockAllURLs();
    }
    const auto findsAgain = [&](const CXDChangeRecord& record) { return conduits.vaultra->findsAgain(record); };
    _parts->state.withConduitData(
        [&](Dictionary& data) { holdBackRefusedChanges(data, gathered, findsAgain, _parts->with.clock.now()); });
    return gathered;
}

void CXDSyncEngine::applyChangeRecords(const CXDChangeRecords& records) {
    applyChangeRecords(records, true);
}

void CXDSyncEngine::applyChangeRecords(const CXDChangeRecords& records, bool trickle) {
    applyChangeRecords(records, trickle, true);
}

void CXDSyncEngine::applyChangeRecords(CXDChangeRecords records, bool trickle, bool allowRetry) {
    // Whoever delivers them must not take them for done.
    if (_parts->ending)
        throw CXException(kCXInvalidArgumentException, "the process is ending, and its changes wait for the next one");
    runPass({!trickle, false}, [this, trickle, allowRetry, records = std::move(records)]() mutable {
        apply(std::move(records), trickle, allowRetry);
    });
}

void CXDSyncEngine::apply(CXDChangeRecords records, bool trickle, bool allowRetry) {
    ApplyLoop loop(*_parts, {[this] { armIdleExit(); }, [this] { scheduleRetry(); }});
    loop.run(std::move(records), trickle, allowRetry);
}

void CXDSyncEngine::cxdSubscribed(const Notification&) {
    bringSourcesUpToDate();
}

void CXDSyncEngine::cxdAllACLChanged(const Notification&) {
    bringSourcesUpToDate();
}

void CXDSyncEngine::cxdPublishedAll(const Notification&) {
    bringSourcesUpToDate();
}

void CXDSyncEngine::cxdSynced(const Notification& notification) {
    if (notification.object != _parts->with.loginName) bringSourcesUpToDate();
}

// -- state

Dictionary CXDSyncEngine::conduitData() {
    return _parts->state.conduitData();
}
Dictionary CXDSyncEngine::conduitObjectForKey(const std::string& conduitID, const std::string& key) {
    return _parts->state.conduitObjectForKey(conduitID, key);
}
void CXDSyncEngine::setConduitObjectForKey(const std::string& conduitID, const Value& object, const std::string& key) {
    _parts->state.setConduitObjectForKey(conduitID, object, key);
}
Dictionary CXDSyncEngine::knownGroupState(const std::string& conduitID, const UserName& user, const UniqueId& group) {
    Dictionary known;
    _parts->state.withConduitData([&](Dictionary& data) {
        const Dictionary users = data[conduitID].dictionary()[kPriorState].dictionary();
        const Value& state = users[user.str()].dictionary()[group.str()];
        known = state.deepMutableCopy().dictionary();
    });
    return known;
}
void CXDSyncEngine::saveInThePass() {
    _parts->saveInThePass = true;
}
std::optional<uint64_t> CXDSyncEngine::stateGeneration() {
    return _parts->state.generation();
}
void CXDSyncEngine::syncPrefs() {
    _parts->state.syncPrefs();
}
CXDChangeRecords CXDSyncEngine::getPendingChanges() const {
    return _parts->state.getPendingChanges();
}
void CXDSyncEngine::setPendingChanges(const CXDChangeRecords& records) {
    _parts->state.setPendingChanges(records);
}
bool CXDSyncEngine::hasPendingChanges(const UserName& user, int32_t source) {
    if (user == kSelf && source == CXDSyncSourceVaultra && hasRefusedChanges(conduitData())) return true;
    const CXDChangeRecords pending = getPendingChanges();
    return std::any_of(pending.begin(), pending.end(), [&](const CXDChangeRecordPtr& record) {
        return record->user() == user && (record->appliesToSources() & source) != 0;
    });
}
void CXDSyncEngine::setRemoteLocationForSubscriptionUID(const std::optional<RemoteLocation>& location,
                                                        const std::optional<UniqueId>& subscription) {
    _parts->state.setRemoteLocationForSubscriptionUID(location, subscription);
}
std::optional<RemoteLocation> CXDSyncEngine::remoteLocationForSubscriptionUID(const UniqueId& subscription) const {
    return _parts->state.remoteLocationForSubscriptionUID(subscription);
}
void CXDSyncEngine::removeSubscriptionMapForRemoteLocation(const RemoteLocation& location) {
    _parts->state.removeSubscriptionMapForRemoteLocation(location);
}
void CXDSyncEngine::saveACLs() {
    rolvane::saveACLs(*_parts);
}
void CXDSyncEngine::reset() {
    _parts->state.reset();
}
void CXDSyncEngine::checkCXShareCount() {
    rolvane::checkCXShareCount(*_parts);
}
void CXDSyncEngine::updateStateAndExitIfNeeded() {
    rolvane::updateStateAndExitIfNeeded(*_parts);
}
void CXDSyncEngine::removeCacheDataForConduit(CXDConduit& conduit) {
    rolvane::removeCacheDataForConduit(*_parts, conduit);
}

CXDConduit* CXDSyncEngine::conduitForSyncSource(int32_t source) {
    switch (source) {
    case CXDSyncSourceCX: return _parts->conduits.cx.get();
    case CXDSyncSourceVaultra: return _parts->conduits.vaultra.get();
    default: return nullptr;
    }
}

// -- conflicts, cache, locks, revocation

void CXDSyncEngine::noteRefused(const Refusal& refusal) {
    _parts->state.noteRefused(refusal);
}
void CXDSyncEngine::storeWasTested(bool reached, int error, const std::string& reason) {
    _parts->outcomes.storeWasTested(
        reached, reached ? std::nullopt : std::optional(PassFailure{{}, {}, 0, error, reason, std::nullopt}));
}
void CXDSyncEngine::treeWasLookedAt(const UserName& user, TreeLook how) {
    _parts->outcomes.treeWasLookedAt(user, how);
}
bool CXDSyncEngine::shouldChangeRecordBeCanceled(const CXDChangeRecord& record) const {
    return _parts->denied.contains(record);
}
void CXDSyncEngine::cancelPendingChangesLike(const CXDChangeRecordPtr& denied, const CXDChangeRecords& amongst) {
    _parts->denied.cancelLike(denied, amongst);
}
Dictionary CXDSyncEngine::payloadMerging(const Dictionary& first, const Dictionary& into) {
    return rolvane::payloadMerging(*_merger, first, into);
}
CXDChangeRecordPtr CXDSyncEngine::mingleChange(const CXDChangeRecordPtr& record, CXDChangeRecords& amongstChanges) {
    return mingleChangeAmongstChanges(*_merger, record, amongstChanges);
}
void CXDSyncEngine::didApplyChange(const CXDChangeRecordPtr& record, int32_t toSource) {
    _parts->state.withConduitData([&](Dictionary& data) { rolvane::didApplyChange(data, *record, toSource); });
}
int32_t CXDSyncEngine::sourcesForGUID(const UniqueId& group) {
    return rolvane::sourcesForGUID(_parts->state.conduitData(), group);
}
bool CXDSyncEngine::isGUIDPublished(const UniqueId& group) {
    return rolvane::isGUIDPublished(_parts->state.conduitData(), group);
}
void CXDSyncEngine::removeGUID(const UniqueId& group) {
    _parts->state.withConduitData([&](Dictionary& data) { rolvane::removeGUID(data, group); });
}
bool CXDSyncEngine::lockURL(const Url& url) {
    return _parts->locks.lockURL(url);
}
void CXDSyncEngine::unlockAllURLs() {
    _parts->locks.unlockAllURLs();
}
bool CXDSyncEngine::isRevoked(const RemoteLocation& location) const {
    return _parts->revoked.contains(location);
}
std::vector<RemoteLocation> CXDSyncEngine::revokedRemoteLocations() const {
    return _parts->revoked.all();
}
void CXDSyncEngine::revokeRemoteLocation(const RemoteLocation& location, const std::optional<UniqueId>& subscription) {
    _parts->revoked.revoke(_parts->state, location, userForRemoteLocation(location), subscription);
}

// -- locations

UserName CXDSyncEngine::userForRemoteLocation(const RemoteLocation& location) const {
    const std::optional<UserName> user =
        rolvane::userForRemoteLocation(location, _parts->with.account.vaultraUser(), _parts->with.loginName);
    if (!user) killCXD();
    return *user;
}

std::optional<RemoteLocation> CXDSyncEngine::baseLocation(int32_t source, const std::optional<UserName>& user) const {
    const CXDConduit* conduit = source == CXDSyncSourceCX        ? _parts->conduits.cx.get()
                                : source == CXDSyncSourceVaultra ? _parts->conduits.vaultra.get()
                                                                 : nullptr;
    if (!conduit) return std::nullopt;
    const std::optional<Url> base = conduit->baseLocationForUser(conduit->realUserFromUser(user));
    return base ? std::optional(RemoteLocation(base->absoluteString())) : std::nullopt;
}

} // namespace rolvane
