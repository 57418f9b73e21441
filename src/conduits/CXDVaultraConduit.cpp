#include "conduits/CXDVaultraConduit.h"

#include "acl/CXDAVACLManager.h"
#include "conduits/EndedPublication.h"
#include "conduits/LocalizedText.h"
#include "conduits/PublishedLayout.h"
#include "conduits/StoreComparison.h"
#include "conduits/TreeCondition.h"
#include "conduits/UserAlert.h"
#include "contacts/CXRolvane.h"
#include "contacts/Constants.h"
#include "contacts/Identifier.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/CXDAVManager.h"
#include "store/CXNetworkController.h"

#include <set>
#include <utility>

namespace rolvane {
namespace {

constexpr int kOk = 200;
constexpr int kForbidden = 403;
constexpr int kMissing = 404;
// In the prior state of the owner's tree: something was amiss there that may be so for a moment only.
constexpr const char* kLookAgain = "LookAgain";

// The payload, decoded for this one use where it stands encoded: the record keeps no tree of it.
Dictionary contentOf(CXDChangeRecord& record) {
    if (const auto encoded = record.encodedPayload()) return BinaryValue::decode(*encoded).dictionary();
    return record.payload().dictionary();
}

using ACLChange = void (CXACLManager::*)(const UniqueId&, const std::vector<UniqueId>&, const UserName&);

void changeACL(CXACLManager& manager, const UniqueId& group, const Dictionary& differences,
               const std::vector<UniqueId>& members, ACLChange grant, ACLChange deny) {
    for (const Value& principal : differences[kAdditions].array())
        (manager.*grant)(group, members, UserName(principal.string()));
    for (const Value& principal : differences[kDeletions].array())
        (manager.*deny)(group, members, UserName(principal.string()));
}

Array arrayOf(const std::vector<UserName>& principals) {
    Array all;
    for (const UserName& principal : principals) all.append(principal);
    return all;
}

// What the store is known to hold as members of the record's group in that user's tree.
std::vector<UniqueId> knownMembers(ConduitEngine& engine, const std::optional<UserName>& user,
                                   const CXDChangeRecord& record) {
    if (!user || !record.group()) return {};
    const Dictionary state = engine.conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary group = state[user->str()].dictionary()[record.group()->str()].dictionary();
    std::vector<UniqueId> members;
    for (const Value& member : group[kMemberUIDState].array()) members.emplace_back(member.string());
    return members;
}

} // namespace

CXDVaultraConduit::CXDVaultraConduit(ConduitEngine& engine, World world)
    : CXDConduit(engine), _world(std::move(world)) {
    _simulated = _world.distributed.observe(
        "SimulateVaultraNotification", [this](const Notification&) { vaultraSynced(); }, true);
    _networkChanged = _world.notifications.observe(kCXNetworkConfigurationDidChangeNotification,
                                                   [this](const Notification&) { networkChanged(); });
}

CXDVaultraConduit::~CXDVaultraConduit() {
    awaitStructure();
    if (_serverDate.valid()) _serverDate.wait();
}

std::optional<std::string> CXDVaultraConduit::conduitID() const {
    return kConduitVaultra;
}

std::optional<UserName> CXDVaultraConduit::realUserFromUser(const std::optional<UserName>& user) const {
    return user == kSelf ? _world.manager.account().user : user;
}

int32_t CXDVaultraConduit::conduitSource() const {
    return CXDSyncSourceVaultra;
}

CXFileManager* CXDVaultraConduit::defaultManager() const {
    return &_world.manager;
}

std::optional<Url> CXDVaultraConduit::baseLocationForUser(const std::optional<UserName>& user) const {
    if (!user) return std::nullopt;
    const std::lock_guard guard(_basesLock);
    const auto [found, isNew] = _bases.try_emplace(*user);
    if (isNew) found->second = _world.manager.account().baseLocationFor(*user);
    return found->second;
}

std::optional<Url> CXDVaultraConduit::baseLocationOf(const CXDChangeRecord& record) const {
    return baseLocationForUser(realUserFromUser(record.user()));
}

// -- reachability and the pass's frame

int CXDVaultraConduit::testReachability(const std::function<void()>& meanwhile) {
    CXDAVError error;
    const std::vector<std::string> origins = _world.manager.account().origins();
    const std::string address = origins.empty() ? "" : Url(origins.front() + "/").host();
    // Without a route nobody is asked, so nobody can refuse the password either.
    const bool routed = _world.network.canReachAddress(address);
    if (!routed) error = {0, "There is no network."};
    const bool online = routed && _world.manager.canReach(error, meanwhile);
    _vaultraOffLine = !online;
    engine().storeWasTested(online, online ? 0 : error.code, online ? std::string() : error.reason);
    CXDLog("Vaultra is %@", online ? "online" : "offline");
    return error.code;
}

// What a gathering asks first of a subscribed tree goes along with the test of the store and the login.
void CXDVaultraConduit::beginReading() {
    for (const CXSubscriptionRef& subscription : _world.rolvane.subscriptions()) {
        const RemoteLocation location = subscription->remoteLocation();
        if (syncSourceForRemoteLocation(location) != conduitSource()) continue;
        const UserName user = engine().userForRemoteLocation(location);
        const auto base = user.empty() || user == kSelf ? std::nullopt : baseLocationForUser(user);
        if (!base) continue;
        _world.manager.expectSomeReads({base->cxURLByAppendingComponent(layout::kInfo)}, false);
        _world.manager.expectListing(*base);
        return; // a wrong password is not to be offered many times
    }
}

// A gathering reads a tree of which something is known, and finds it whole then.
void CXDVaultraConduit::lookAfterStructure(bool meanwhile) {
    awaitStructure();
    if (!meanwhile) {
        sanityCheckPublishStructure();
        return;
    }
    const std::lock_guard guard(_structureLock);
    _structure = std::async(std::launch::async, [this] {
        try {
            sanityCheckPublishStructure();
        } catch (const CXException& exception) {
            CXLog("The published tree could not be looked after: %@", exception);
        }
    });
}

void CXDVaultraConduit::awaitStructure() {
    const std::lock_guard guard(_structureLock);
    if (_structure.valid()) _structure.get();
}

void CXDVaultraConduit::open() {
    const bool gathering = std::exchange(_gathering, false);
    if (_serverDate.valid()) _serverDate.wait(); // of a pass that failed
    _serverDate = {};
    _world.manager.expectNothing();
    _writes.giveUpMerged(); // of a pass that failed
    _setBack.clear();
    _publishesAgain = !engine().conduitObjectForKey(kConduitCX, kPublishAgain).empty();
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
    _lastSyncDate = _world.preferences.get(kDaemonDomain, kLastSyncDateKey).date().value_or(Date::distantPast());
    if (_vaultraOffLine) return;
    _isWrittenByOthers = somebodyMayWrite();
    forgetSubscribersRights();
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    _world.manager.keepSerialNumber(users[kSelf.str()].dictionary()[kSerialNumber].string());
    lookAfterStructure(gathering && !users.contains(kSelf.str()));
}

void CXDVaultraConduit::willClose() {
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    if (_vaultraOffLine || _serverDate.valid() || users.contains(kSelf.str()) || isToBePublishedAgain()) return;
    _serverDate = std::async(std::launch::async, [this] { return currentServerDate(); });
}

void CXDVaultraConduit::close() {
    CXDConduit::close();
    awaitStructure();
    _world.manager.expectNothing();
    if (_vaultraOffLine) return;
    _world.manager.saveVersionMemory();
    if (isToBePublishedAgain()) return;
    std::optional<Date> now = _serverDate.valid() ? _serverDate.get() : std::nullopt;
    if (!now) now = currentServerDate();
    CXDLog("Closing, last sync: %@", now);
    // A store that went away during the pass tells no date: keeping the old one costs reads, a guessed one loses edits.
    if (!now) return;
    _lastSyncDate = now;
    _world.preferences.set(kDaemonDomain, kLastSyncDateKey, *now);
    _world.preferences.synchronize(kDaemonDomain);
}

std::optional<Date> CXDVaultraConduit::currentServerDate() {
    awaitStructure();
    const auto base = baseLocationForUser(realUserFromUser(kSelf));
    if (!base) return std::nullopt;
    const Url dateFile = layout::dateFileLocation(*base);
    _world.manager.write(std::string(layout::kClockText), dateFile, false);
    return _world.manager.modDateForURL(dateFile);
}

bool CXDVaultraConduit::sanityCheckPublishStructure() {
    return _world.manager.sanityCheckPublishStructureCreate(true);
}

void CXDVaultraConduit::networkChanged() {
    CXDLog("Network changed");
    _world.manager.networkChanged();
    testReachability();
    if (!_vaultraOffLine) engine().bringSourcesUpToDate();
}

void CXDVaultraConduit::vaultraSynced() {
    engine().bringSourcesUpToDate();
}

bool CXDVaultraConduit::shouldWarnUserAboutUserNameOrPassword() const {
    const auto last = _world.preferences.get(kDaemonDomain, kLastWarningDateKey).date();
    return !last || _world.clock.now().secondsSince(*last) > kWarningInterval;
}

void CXDVaultraConduit::warnUserAboutUserNameOrPassword() {
    UserAlert::Text text;
    text.header = localizedText("SHARING_BAD_USERNAME_PASS_HEADER");
    text.message = localizedText("SHARING_BAD_USERNAME_PASS");
    text.defaultButton = localizedText("OK");
    text.icon = "Rolvane";
    _world.alert.show(text);
    _world.preferences.set(kDaemonDomain, kLastWarningDateKey, _world.clock.now());
    _world.preferences.synchronize(kDaemonDomain);
}

Dictionary CXDVaultraConduit::currentState() {
    const CXDAVManager::Snapshot unchangedGroupsAreNotFetched(_world.manager);
    return CXDConduit::currentState();
}

// -- trees that are not what they were

bool CXDVaultraConduit::isTrusted(const UserName& user, const Dictionary& state) {
    const bool isOwn = user == kSelf;
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary* known = users[user.str()].dictionaryIf();
    if (!known) return true;
    Dictionary prior = *known;
    if (isOwn && !isMended(prior, state)) return false;
    const Value knownSerial = prior[kSerialNumber], serial = state[kSerialNumber];
    if (!serial.isString() || (knownSerial.isString() && knownSerial != serial)) return true; // no tree, or another one
    const TreeCondition condition = treeCondition(prior, state, isOwn ? _lastSyncDate : std::nullopt);
    const Value looked = prior[kLookAgain];
    prior.remove(kLookAgain);
    if (condition.isSound()) {
        prior.set(kTreeDates, state[kTreeDates].dictionary());
        _read.emplace(user, state);
        if (isOwn) mendOwnTree(prior, state);
        return true;
    }
    CXLog("The tree of %@ %@. %@", isOwn ? *realUserFromUser(user) : user, condition.sentence,
          isOwn ? "It is published again." : "It is left alone until its owner has mended it.");
    if (condition.kind == TreeCondition::Kind::setBack) prior.set(kTreeDates, datesToWaitFor(state));
    if (!isOwn) {
        _setBack.insert(user);
        return false;
    }
    const bool isRefused = !engine().conduitObjectForKey(kConduitCX, kRefusedByStore).empty();
    if (condition.kind == TreeCondition::Kind::lostAGroup && isRefused) return false; // it could not be written yet
    if (condition.mayPass() && !looked)
        prior.set(kLookAgain, true);
    else
        publishAgain();
    engine().bringSourcesUpToDate(); // after this pass
    return false;
}

// Single files that are too many or too few: another writer has deleted what somebody else was about to write, or the
// store has lost them.
void CXDVaultraConduit::mendOwnTree(const Dictionary& prior, const Dictionary& state) {
    if (_isWrittenByOthers) _leftovers = removalOfUnlisted(prior, state);
    if (!allGroupHas(kCXRemoteLocationProperty)) return; // the list may be older than the withdrawal
    if (_isWrittenByOthers) takeNamesAloneOut(prior, state);
    size_t written = 0;
    for (const UniqueId& name : contactsThatAreMissing(state)) {
        const CXRecordRef person = _world.rolvane.recordForUniqueId(cxUIDWithTableName(name, kCXPersonTable));
        if (!person) continue;
        auto update = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, kSelf, person->uniqueId(),
                                                        std::nullopt, person->dictionaryRepresentation());
        update->setAppliesToSources(CXDSyncSourceVaultra);
        _leftovers.push_back(std::move(update));
        ++written;
    }
    if (written > 0) CXLog("The store has lost the files of %@ contacts, which are written again.", written);
}

// Groups that name a contact or a group which is nowhere, or a group that the owner's database cannot take in.
void CXDVaultraConduit::takeNamesAloneOut(Dictionary prior, const Dictionary& state) {
    const Dictionary alone = namesAlone(
        prior, state, [&](const UniqueId& name) { return _world.rolvane.recordForUniqueId(name) != nullptr; });
    const Dictionary circles = closingCircles(state, [&](const UniqueId& name) {
        std::vector<UniqueId> inner;
        if (const auto group = std::dynamic_pointer_cast<CXGroup>(_world.rolvane.recordForUniqueId(name)))
            inner = group->subgroupUniqueIds();
        for (UniqueId& each : inner) each = cxUIDWithTableName(each, kCXGroupTable);
        return inner;
    });
    const CXDChangeRecords removals = removalOfNamesAlone(prior, alone, circles);
    _leftovers.insert(_leftovers.end(), removals.begin(), removals.end());
    if (const Dictionary all = namesTogether(alone, circles); all.empty())
        prior.remove(kNamesAlone);
    else
        prior.set(kNamesAlone, all);
}

// True when nothing had to be mended, or has been long since. When the last of it is on the store: where nobody but the
// owner may write, what is there beside it comes from an older copy, and goes.
bool CXDVaultraConduit::isMended(const Dictionary& prior, const Dictionary& state) {
    const Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    if (again.empty()) return true;
    if (isToBePublishedAgain()) return false;
    engine().setConduitObjectForKey(kConduitCX, Dictionary(), kPublishAgain);
    if (somebodyMayWrite()) return true;
    _leftovers = removalOfLeftovers(prior, state);
    return _leftovers.empty();
}

bool CXDVaultraConduit::somebodyMayWrite() {
    return allGroupHas(kCXReadWriteSharingACLProperty);
}

// Empty lists stay where somebody was or something stood once.
bool CXDVaultraConduit::allGroupHas(const char* property) {
    const auto entries = _world.rolvane.allGroup()->multiValueForProperty(property);
    return entries && !entries->empty();
}

CXDChangeRecords CXDVaultraConduit::changeRecords() {
    CXDChangeRecords records = CXDConduit::changeRecords();
    if (_world.rolvane.allGroup()->valueForProperty(kCXRemoteLocationProperty) && endedPublication(_world.preferences))
        _world.preferences.remove(kDaemonDomain, kCXDEndedPublication); // published again since
    _publishesAgain = !engine().conduitObjectForKey(kConduitCX, kPublishAgain).empty();
    leaveUnlistedOut(records);
    _read.clear();
    records.insert(records.end(), _leftovers.begin(), _leftovers.end());
    _leftovers.clear();
    return records;
}

// A contact that the list of everybody does not name and that joins no group is about to be added, and comes when it is
// listed; or it has been deleted and was written once more by somebody who did not know. Whoever knows it reads what is
// written. Nobody else takes it in: it would stay behind when its file goes. From the own tree it is taken away.
// (Where single groups are published, the list of everybody does not name all who have joined one since.)
void CXDVaultraConduit::leaveUnlistedOut(CXDChangeRecords& records) {
    std::map<UserName, ListedNames> lists;
    std::set<std::pair<UserName, UniqueId>> joining;
    for (const CXDChangeRecordPtr& record : records)
        if (record->type() == CXDAddRecordToGroup && record->person() && record->user() &&
            _read.contains(*record->user()))
            joining.emplace(*record->user(), *record->person());
    std::erase_if(records, [&](const CXDChangeRecordPtr& record) {
        if (record->type() != CXDUpdateRecord || !record->person() || !record->user()) return false;
        const auto read = _read.find(*record->user());
        if (read == _read.end()) return false;
        if (joining.contains({*record->user(), *record->person()})) return false;
        const UniqueId shared = cxNormalizedUID(*record->person());
        if (lists.try_emplace(*record->user(), read->second, kMemberUIDState).first->second.contains(shared))
            return false;
        if (_world.rolvane.recordForUniqueId(*record->person())) return false;
        CXDLog("Not listed, and left out: %@", record);
        if (record->user() == kSelf && _isWrittenByOthers) _leftovers.push_back(removalOfContact(shared));
        return true;
    });
}

// The next scan takes everything for new.
void CXDVaultraConduit::publishAgain() {
    engine().conduitObjectForKey(kConduitCX, kPublishAgain).set(kSelf.str(), false);
    restoreAccessLists();
}

// Lists may have gone with the tree or be of another time: who was let in since then stays, who was shut out stays out.
void CXDVaultraConduit::restoreAccessLists() {
    const auto base = baseLocationForUser(realUserFromUser(kSelf));
    if (!base || !keepsAccessLists()) return;
    if (_ACLManagerMap) _ACLManagerMap->erase(base->absoluteString()); // it knows what was there
    const auto manager = ACLManagerForRemoteLocation(*base);
    if (!manager || !manager->isKnown()) return;
    const Dictionary groups = engine().conduitObjectForKey(kConduitCX, kPriorState)[kSelf.str()].dictionary();
    Array readers, writers;
    for (const auto& [name, group] : groups) {
        readers = cxArrayCombinedWithArray(readers, group.dictionary()[kCXReadSharingACLProperty].array());
        writers = cxArrayCombinedWithArray(writers, group.dictionary()[kCXReadWriteSharingACLProperty].array());
    }
    const UniqueId everybody{std::string(layout::kAllGroup)};
    changeACL(*manager, everybody, cxDifferencesBetweenArray(arrayOf(manager->principalsWithReadAccess()), readers), {},
              &CXACLManager::grantReadPermissionForGUID, &CXACLManager::denyReadPermissionForGUID);
    changeACL(*manager, everybody, cxDifferencesBetweenArray(arrayOf(manager->principalsWithAllAccess()), writers), {},
              &CXACLManager::grantReadWritePermissionForGUID, &CXACLManager::denyReadWritePermissionForGUID);
}

// Lists that another publication has are not this database's to change.
void CXDVaultraConduit::ownPublicationEnds(const Url& base, bool replaced) {
    if (!_world.rolvane.allGroup()->valueForProperty(kCXRemoteLocationProperty)) return; // by the owner's doing
    const Dictionary prior = engine().conduitObjectForKey(kConduitCX, kPriorState)[kSelf.str()].dictionary();
    const auto taken = [&](const char* property) {
        const auto listed = _world.rolvane.allGroup()->multiValueForProperty(property);
        return takenAway(prior, property, listed ? listed->_allValues() : Array());
    };
    const Array readers = taken(kCXReadSharingACLProperty), writers = taken(kCXReadWriteSharingACLProperty);
    const Dictionary unsaved = _world.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary();
    EndedPublication ended{_world.clock.now(), replaced, {}};
    if (replaced) {
        const Array before = arrayOf(CXDAVACLManager::deniedIn(unsaved[base.absoluteString()].array()));
        for (const Value& name : cxArrayCombinedWithArray(before, cxArrayCombinedWithArray(readers, writers)))
            ended.mayStillRead.emplace_back(name.string());
    } else if (const auto manager = keepsAccessLists() ? ACLManagerForRemoteLocation(base) : nullptr) {
        const UniqueId everybody{std::string(layout::kAllGroup)};
        changeACL(*manager, everybody, Dictionary{{kDeletions, readers}}, {}, &CXACLManager::grantReadPermissionForGUID,
                  &CXACLManager::denyReadPermissionForGUID);
        changeACL(*manager, everybody, Dictionary{{kDeletions, writers}}, {},
                  &CXACLManager::grantReadWritePermissionForGUID, &CXACLManager::denyReadWritePermissionForGUID);
        saveACLs(); // at once: the process may end with the publication
        ended.mayStillRead = CXDAVACLManager::deniedIn(manager->unsaved());
    }
    CXLog("The publication has ended: %@.",
          replaced ? "another one lies in its place" : "the store forbids it, or has nothing of it any more");
    noteEndedPublication(_world.preferences, ended);
    _world.alert.tell(noticeOf(ended));
}

// Until all of it is written, what the owner's tree says is not news, and nobody is told that the owner has been there.
bool CXDVaultraConduit::isToBePublishedAgain() {
    const Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    if (again.empty()) return false;
    return !again[kSelf.str()].boolean() || engine().hasPendingChanges(kSelf, conduitSource());
}

// -- applying

bool CXDVaultraConduit::lockStructureForRecord(const CXDChangeRecord& record) {
    awaitStructure();
    const auto base = baseLocationOf(record);
    return base && engine().lockURL(layout::dateFileLocation(*base));
}

bool CXDVaultraConduit::applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) {
    if (denied) *denied = false;
    if (_vaultraOffLine || !lockStructureForRecord(*record)) return false;
    int code = 0;
    const bool applied = mayBeNamed(record) ? apply(*record, code) : true;
    if (denied) *denied = code == kForbidden;
    return applied;
}

void CXDVaultraConduit::wasRefused(const CXDChangeRecord& record) {
    const bool isContact = record.type() == CXDUpdateRecord || record.type() == CXDDeleteRecord;
    const auto base = baseLocationOf(record);
    const bool isEdit = record.type() == CXDUpdateRecord && record.initialSource() == CXDSyncSourceCX;
    if (isEdit && record.person() && !record.changeMadeByDataOwner()) forgetEdit(record);
    if (isContact && base && record.person())
        _world.manager.forgetVersion(layout::contactLocation(*base, cxNormalizedUID(*record.person())));
}

// The store will never take this edit, so its version must not be merged with the edit.
void CXDVaultraConduit::forgetEdit(const CXDChangeRecord& record) {
    const UniqueId uid = inDatabase(record);
    if (const auto row = _world.rolvane.personRow(uid)) _world.rolvane.setCommonVersion(uid, row->encoded);
}

// Identifiers also come out of other people's lists: one that names the tree's own files would destroy those. What has
// such a name stays where it is, and its change does not wait for ever.
bool CXDVaultraConduit::mayBeNamed(const CXDChangeRecordPtr& record) {
    for (const auto& name : {record->person(), record->group()}) {
        if (!name || layout::isARecordsName(*name)) continue;
        CXLog("\"%@\" is a name of the published tree's own, and no contact or group can be kept under it. The change "
              "stays in this database: %@",
              *name, record->description());
        engine().noteRefused({record->user().value_or(UserName()), kRefusedForItsName});
        if (record->type() == CXDUpdateRecord && record->person()) forgetEdit(*record);
        return false;
    }
    return true;
}

bool CXDVaultraConduit::apply(CXDChangeRecord& record, int& code) {
    switch (record.type()) {
    case CXDUpdateRecord: return updateRecord(record, code);
    case CXDCreateStructureForGroup: return createStructureForGroup(record, code);
    case CXDCompositeGroupChange: return makeCompositeGroupChange(record, code);
    case CXDChangeGroupName: return changeGroupName(record, code);
    case CXDAddRecordToGroup: return addRecordToGroup(record, code);
    case CXDChangeGroupReadACL: return changeGroupReadACL(record);
    case CXDChangeGroupReadWriteACL: return changeGroupReadWriteACL(record);
    case CXDRemoveRecordFromGroup: return true; // markers stay on the network store
    case CXDDeleteRecord: return deleteRecord(record, code);
    case CXDDeleteGroup: return deleteGroup(record, code);
    default: return false;
    }
}

bool CXDVaultraConduit::updateRecord(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.person()) return false;
    const UserName user = record.user().value_or(UserName());
    const UniqueId shared = cxNormalizedUID(*record.person()), everybody{std::string(layout::kAllGroup)};
    const ContactWrites::Place place{user,
                                     layout::contactLocation(*base, *record.person()),
                                     inDatabase(record),
                                     mergesInto(user),
                                     layout::groupLocation(*base, everybody),
                                     [&] {
                                         const Dictionary list =
                                             engine().knownGroupState(kConduitVaultra, user, everybody);
                                         return list[kMemberUIDState].array().containsString(shared.str());
                                     }};
    return _writes.write(place, contentOf(record), code);
}

// A shared identifier means the owner's own contact in the own tree, and in another one the copy that came from there,
// also when somebody has deleted that meanwhile.
UniqueId CXDVaultraConduit::inDatabase(const CXDChangeRecord& record) {
    const UniqueId own = cxUIDWithTableName(*record.person(), kCXPersonTable);
    if (record.changeMadeByDataOwner()) return own;
    return cxUIDWithTableName(own, kCXSubscribedPersonTable);
}

// Where nobody else writes there is nothing to merge with. What an older copy of a tree holds is no news.
bool CXDVaultraConduit::mergesInto(const UserName& user) {
    if (user == kSelf) return _isWrittenByOthers && !_publishesAgain;
    return !_setBack.contains(user);
}

CXDChangeRecords CXDVaultraConduit::takeMerged() {
    CXDChangeRecords updates;
    for (const ContactWrites::Merged& merged : _writes.takeMerged()) {
        if (!_world.rolvane.personRow(merged.place.uniqueId)) continue; // deleted meanwhile, and so it stays
        Dictionary content = merged.contact.mutableCopy();
        const auto base = baseLocationForUser(realUserFromUser(merged.place.user));
        if (merged.place.user != kSelf && base)
            stampWithRemoteLocation(content, RemoteLocation(base->absoluteString()));
        auto update = std::make_shared<CXDChangeRecord>(conduitSource(), CXDUpdateRecord, merged.place.user,
                                                        merged.place.uniqueId, std::nullopt, std::move(content));
        update->setAppliesToSources(CXDSyncSourceCX);
        updates.push_back(std::move(update));
    }
    return updates;
}

std::optional<Date> CXDVaultraConduit::dateOfContact(const CXDChangeRecord& record) {
    const auto base = baseLocationOf(record);
    if (_vaultraOffLine || !base || !record.person()) return std::nullopt;
    return _world.manager.modDateForURL(layout::contactLocation(*base, cxNormalizedUID(*record.person())));
}

bool CXDVaultraConduit::createStructureForGroup(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    // Whether the directory could be made shows in the write below it.
    _world.manager.createDirectoryAtAURL(layout::groupLocation(*base, *record.group()));
    return _world.manager.write(stringForDictionary(contentOf(record)),
                                layout::groupInfoLocation(*base, *record.group()), kSecureRecordWrites, &code);
}

bool CXDVaultraConduit::makeCompositeGroupChange(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    const Url location = layout::groupLocation(*base, *record.group());
    auto state = _world.manager.dictionaryAtURL(location, false, &code);
    if (!state && code == kMissing) {
        const bool isList = record.group()->str() == layout::kAllGroup;
        if (isList && !record.changeMadeByDataOwner()) return false; // it waits for its owner's
        if (wasDeletedThere(record)) return true;
    }
    // A part alone would be taken for all of it.
    if (!state && (code == kMissing || code == kOk)) state = lastKnownState(record);
    const Dictionary changed = layout::groupStateAfterComposite(state.value_or(Dictionary()), contentOf(record));
    // A state that is there and could not be read is not replaced by a part of it: the client then sends no write, and
    // the answer to the read stands.
    int written = 0;
    const bool done = _world.manager.write(stringForDictionary(changed), location, kSecureRecordWrites, &written);
    if (written != 0) code = written;
    return done;
}

// A group that is known and whose state is gone, asked twice: somebody else who may write has deleted it, and a part of
// it would bring it back without its name and members. The change is given up. Where the store has lost the state of an
// own group, the next look at the tree finds that out, and all of it is published again.
bool CXDVaultraConduit::wasDeletedThere(CXDChangeRecord& record) {
    if (!record.user() || !record.group() || (record.changeMadeByDataOwner() && !_isWrittenByOthers)) return false;
    const Dictionary known = engine().knownGroupState(kConduitVaultra, *record.user(), *record.group());
    if (known.empty()) return false;
    int code = 0;
    const Url location = layout::groupLocation(*baseLocationOf(record), *record.group());
    if (_world.manager.dictionaryAtURL(location, false, &code) || code != kMissing) return false;
    if (record.group()->str() == layout::kAllGroup) return true; // it will be seen that the tree has lost its lists
    CXLog("The group has been deleted by somebody else, and is not changed any more: %@", record.description());
    engine().noteRefused({*record.user(), kRefusedAsGroupIsGone, known[kCXGroupNameProperty].string()});
    return true;
}

// In the place of a state file that is lost or has come to harm: what it held when it was seen last, as far as such a
// file says it. Of a list of everybody that was never seen, what the owner's database is known to publish.
Dictionary CXDVaultraConduit::lastKnownState(const CXDChangeRecord& record) {
    if (!record.user() || !record.group()) return {};
    Dictionary known = engine().knownGroupState(kConduitVaultra, *record.user(), *record.group());
    if (known.empty() && record.changeMadeByDataOwner() && record.group()->str() == layout::kAllGroup)
        known = engine().knownGroupState(kConduitCX, *record.user(), *record.group());
    Dictionary state;
    for (const char* key : {kMemberUIDState, kSubgroupUIDState, kCXGroupNameProperty, kDistributionListState})
        if (const Value& part = known[key]) state.set(key, part);
    return state;
}

bool CXDVaultraConduit::changeGroupName(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    return _world.manager.write(stringForDictionary(layout::infoAfterRename(record.payload())),
                                layout::groupInfoLocation(*base, *record.group()), false, &code);
}

bool CXDVaultraConduit::addRecordToGroup(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group() || !record.person()) return false;
    return _world.manager.write(std::string(layout::kMemberMarkerText),
                                layout::memberMarkerLocation(*base, *record.group(), *record.person()), false, &code);
}

bool CXDVaultraConduit::deleteRecord(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.person()) return false;
    return _world.manager.removeFileAtURL(layout::contactLocation(*base, *record.person()), &code);
}

bool CXDVaultraConduit::deleteGroup(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    return _world.manager.removeFileAtURL(layout::groupLocation(*base, *record.group()), &code);
}

// -- access lists; they reach the store when the managers are saved at the end of the pass

// The read change looks the members up under the account's name, the read-write change under the record's own user.
bool CXDVaultraConduit::changeGroupReadACL(CXDChangeRecord& record) {
    const auto base = baseLocationOf(record);
    const auto manager = base ? ACLManagerForRemoteLocation(*base) : nullptr;
    if (manager)
        changeACL(*manager, record.group().value_or(UniqueId()), record.payload().dictionary(),
                  knownMembers(engine(), realUserFromUser(record.user()), record),
                  &CXACLManager::grantReadPermissionForGUID, &CXACLManager::denyReadPermissionForGUID);
    return true;
}

bool CXDVaultraConduit::changeGroupReadWriteACL(CXDChangeRecord& record) {
    const auto base = baseLocationOf(record);
    const auto manager = base ? ACLManagerForRemoteLocation(*base) : nullptr;
    if (manager)
        changeACL(*manager, record.group().value_or(UniqueId()), record.payload().dictionary(),
                  knownMembers(engine(), record.user(), record), &CXACLManager::grantReadWritePermissionForGUID,
                  &CXACLManager::denyReadWritePermissionForGUID);
    return true;
}

bool CXDVaultraConduit::saveACLs() {
    awaitStructure();
    const Dictionary unsaved = _world.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary();
    if (!_vaultraOffLine)
        for (const auto& [location, changes] : unsaved) // those of another account wait until it is back
            if (engine().userForRemoteLocation(RemoteLocation(location)) == kSelf)
                ACLManagerForRemoteLocation(Url(location));
    const bool done = CXDConduit::saveACLs();
    noteUnsavedAccessLists();
    return done;
}

void CXDVaultraConduit::noteUnsavedAccessLists() {
    const Dictionary before = _world.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary();
    Dictionary now = before.mutableCopy();
    if (_ACLManagerMap)
        for (const auto& [location, manager] : *_ACLManagerMap) {
            const Array changes = manager->unsaved();
            changes.empty() ? now.remove(location) : now.set(location, changes);
        }
    if (now == before) return;
    _world.preferences.set(kDaemonDomain, kUnsavedAccessListsKey, now.empty() ? Value() : Value(now));
    const auto own = baseLocationForUser(realUserFromUser(kSelf));
    auto ended = endedPublication(_world.preferences);
    if (!ended || ended->replaced || !own || now.contains(own->absoluteString())) return;
    ended->mayStillRead.clear();
    noteEndedPublication(_world.preferences, *ended);
}

bool CXDVaultraConduit::keepsAccessLists() const {
    return _world.manager.keepsAccessLists().value_or(false);
}

// What somebody else lets us do may have changed since it was asked; nothing of ours is lost with the answer.
void CXDVaultraConduit::forgetSubscribersRights() {
    if (_ACLManagerMap && keepsAccessLists())
        std::erase_if(*_ACLManagerMap, [](const auto& entry) { return !entry.second->publisher(); });
}

std::shared_ptr<CXACLManager> CXDVaultraConduit::ACLManagerForRemoteLocation(const Url& location) {
    if (auto known = CXDConduit::ACLManagerForRemoteLocation(location)) return known;
    const auto base = baseLocationForRemoteLocation(location);
    if (!base) return nullptr;
    std::shared_ptr<CXACLManager> manager;
    if (_world.makeACLManager)
        manager = _world.makeACLManager(*base, engine());
    else
        manager = std::make_shared<CXDAVACLManager>(*base, engine(), _world.manager);
    if (manager->publisher())
        manager->resume(
            _world.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary()[base->absoluteString()].array());
    _ACLManagerMap->insert_or_assign(base->absoluteString(), manager);
    return manager;
}

} // namespace rolvane
