#include "conduits/store/CXDVaultraConduit.h"

#include "conduits/LocalizedText.h"
#include "conduits/PublishedLayout.h"
#include "conduits/UserAlert.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/database/CXRolvane.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Preferences.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/account/CXNetworkController.h"
#include "store/dav/CXDAVManager.h"

#include <future>
#include <utility>

namespace rolvane {

CXDVaultraConduit::CXDVaultraConduit(ConduitEngine& engine, Collaborators with)
    : CXDConduit(engine), _with(std::move(with)) {
    _simulated = _with.distributed.observe(
        "SimulateVaultraNotification", [this](const Notification&) { vaultraSynced(); }, true);
    _networkChanged = _with.notifications.observe(kCXNetworkConfigurationDidChangeNotification,
                                                  [this](const Notification&) { networkChanged(); });
}

CXDVaultraConduit::~CXDVaultraConduit() {
    awaitStructure();
    if (_serverDate.valid()) _serverDate.wait();
}

void CXDVaultraConduit::willGather() {
    _gathering = true;
    _foundAgain.clear();
}

std::optional<std::string> CXDVaultraConduit::conduitID() const {
    return kConduitVaultra;
}

std::optional<UserName> CXDVaultraConduit::realUserFromUser(const std::optional<UserName>& user) const {
    return user == kSelf ? _with.manager.account().user : user;
}

int32_t CXDVaultraConduit::conduitSource() const {
    return CXDSyncSourceVaultra;
}

CXFileManager* CXDVaultraConduit::defaultManager() const {
    return &_with.manager;
}

std::optional<Url> CXDVaultraConduit::baseLocationForUser(const std::optional<UserName>& user) const {
    if (!user) return std::nullopt;
    const Lock guard(_basesLock);
    const auto [found, isNew] = _bases.try_emplace(*user);
    if (isNew) found->second = _with.manager.account().baseLocationFor(*user);
    return found->second;
}

std::optional<Url> CXDVaultraConduit::baseLocationOf(const CXDChangeRecord& record) const {
    return baseLocationForUser(realUserFromUser(record.user()));
}

// -- reachability and the pass's frame

int CXDVaultraConduit::testReachability(const std::function<void()>& meanwhile) {
    CXDAVError error;
    const std::vector<std::string> origins = _with.manager.account().origins();
    const std::string address = origins.empty() ? "" : Url(origins.front() + "/").host();
    // Without a route nobody is asked, so nobody can refuse the password either.
    const bool routed = _with.network.canReachAddress(address);
    if (!routed) error = {0, "There is no network."};
    const bool online = routed && _with.manager.canReach(error, meanwhile);
    _vaultraOffLine = !online;
    engine().storeWasTested(online, online ? 0 : error.code, online ? std::string() : error.reason);
    CXDLog("Vaultra is %@", online ? "online" : "offline");
    return error.code;
}

// The first requests of a gathering for a subscribed tree go along with the test of the store and the login.
void CXDVaultraConduit::beginReading() {
    for (const CXSubscriptionRef& subscription : _with.rolvane.subscriptions()) {
        const RemoteLocation location = subscription->remoteLocation();
        if (syncSourceForRemoteLocation(location) != conduitSource()) continue;
        const UserName user = engine().userForRemoteLocation(location);
        const auto base = user.empty() || user == kSelf ? std::nullopt : baseLocationForUser(user);
        if (!base) continue;
        if (!_moments.contains(user)) // else it is read when the tree has changed
            _with.manager.expectSomeReads({base->cxURLByAppendingComponent(layout::kInfo)}, false);
        _with.manager.expectListing(*base);
        return; // a wrong password is not to be offered many times
    }
}

// A gathering reads a tree that the prior state has, and finds it whole then. A tree that was whole before is taken for
// it: reading it, the lock and the writes meet what is missing.
void CXDVaultraConduit::lookAfterStructure(bool meanwhile) {
    awaitStructure();
    if (_with.manager.knowsPublishStructure()) return;
    if (!meanwhile) {
        sanityCheckPublishStructure();
        return;
    }
    const Lock guard(_structureLock);
    _structure = std::async(std::launch::async, [this] {
        try {
            sanityCheckPublishStructure();
        } catch (const CXException& exception) {
            CXLog("The published tree could not be looked after: %@", exception);
        }
    });
}

void CXDVaultraConduit::awaitStructure() {
    const Lock guard(_structureLock);
    if (_structure.valid()) _structure.get();
}

void CXDVaultraConduit::open() {
    const bool gathering = std::exchange(_gathering, false);
    if (_serverDate.valid()) _serverDate.wait(); // of a pass that failed
    _serverDate = {};
    _with.manager.expectNothing();
    _with.manager.useVersionMemoryOf(database().databaseIdentity(), database().shareCount());
    _writes.giveUpMerged(); // of a pass that failed
    _writtenInOrder.clear();
    _compared.clear(); // of a pass that failed
    _lookedAt.clear();
    readPublishAgain();
    const int code = testReachability(gathering ? [this] { beginReading(); } : std::function<void()>());
    if (code == kCXDAVErrorAuthentication) {
        if (shouldWarnUserAboutUserNameOrPassword()) {
            CXDLog("Username or password is incorrect. Displaying visual warning");
            warnUserAboutUserNameOrPassword();
        } else {
            CXDLog("Username or password is incorrect. No visual warning");
        }
        engine().cancel();
    }
    _lastSyncDate = _with.preferences.get(kDaemonDomain, kLastSyncDateKey).date().value_or(Date::distantPast());
    if (_vaultraOffLine) return;
    openAsOneOfSeveral();
    _isWrittenByOthers = somebodyMayWrite();
    forgetSubscribersRights();
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    _with.manager.keepSerialNumber(users[kSelf.str()].dictionary()[kSerialNumber].string());
    if (!_takesIn) lookAfterStructure(gathering && !users.contains(kSelf.str()));
}

void CXDVaultraConduit::willClose() {
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    if (_vaultraOffLine || _serverDate.valid() || users.contains(kSelf.str()) || isToBePublishedAgain() || _takesIn)
        return;
    _serverDate = std::async(std::launch::async, [this] { return currentServerDate(); });
}

void CXDVaultraConduit::close() {
    CXDConduit::close();
    awaitStructure();
    _with.manager.expectNothing();
    if (_vaultraOffLine) return;
    if (_takesIn) return closeTakingIn();
    if (isToBePublishedAgain()) return;
    std::optional<Date> now = _serverDate.valid() ? _serverDate.get() : std::nullopt;
    if (!now) now = currentServerDate();
    CXDLog("Closing, last sync: %@", now);
    // A store that went away during the pass tells no date: keeping the old one costs reads, a guessed one loses edits.
    if (!now) return;
    if (isLeftOut("date of the store")) now = _with.clock.now();
    _lastSyncDate = now;
    _with.preferences.set(kDaemonDomain, kLastSyncDateKey, *now);
    _with.preferences.synchronize(kDaemonDomain);
}

void CXDVaultraConduit::passWasStored() {
    forgetWhatIsKnown();
    if (!_vaultraOffLine) _with.manager.saveVersionMemory(database().databaseIdentity(), database().shareCount());
}

void CXDVaultraConduit::passWasNotStored() {
    _with.manager.revertVersionMemory();
}

std::optional<Date> CXDVaultraConduit::currentServerDate() {
    awaitStructure();
    const auto base = baseLocationForUser(realUserFromUser(kSelf));
    if (!base) return std::nullopt;
    const Url dateFile = layout::dateFileLocation(*base);
    _with.manager.write(std::string(layout::kClockText), dateFile, false);
    return _with.manager.modDateForURL(dateFile);
}

bool CXDVaultraConduit::sanityCheckPublishStructure() {
    return _with.manager.sanityCheckPublishStructureCreate(true);
}

void CXDVaultraConduit::networkChanged() {
    CXDLog("Network changed");
    _with.manager.networkChanged();
    testReachability();
    if (!_vaultraOffLine) engine().bringSourcesUpToDate();
}

void CXDVaultraConduit::vaultraSynced() {
    engine().bringSourcesUpToDate();
}

bool CXDVaultraConduit::shouldWarnUserAboutUserNameOrPassword() const {
    const auto last = _with.preferences.get(kDaemonDomain, kLastWarningDateKey).date();
    return !last || _with.clock.now().secondsSince(*last) > kWarningInterval;
}

void CXDVaultraConduit::warnUserAboutUserNameOrPassword() {
    UserAlert::Text text;
    text.header = localizedText("SHARING_BAD_USERNAME_PASS_HEADER");
    text.message = localizedText("SHARING_BAD_USERNAME_PASS");
    text.defaultButton = localizedText("OK");
    text.icon = "Rolvane";
    _with.alert.show(text);
    _with.preferences.set(kDaemonDomain, kLastWarningDateKey, _with.clock.now());
    _with.preferences.synchronize(kDaemonDomain);
}

Dictionary CXDVaultraConduit::currentState() {
    const CXDAVManager::Snapshot unchangedGroupsAreNotFetched(_with.manager);
    return CXDConduit::currentState();
}

} // namespace rolvane
