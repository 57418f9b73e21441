#include "conduits/database/CXDCXConduit.h"

#include "conduits/EditsAlone.h"
#include "conduits/PublishedLayout.h"
#include "conduits/TakingIn.h"
#include "conduits/database/ChangeCapture.h"
#include "conduits/database/ContactReader.h"
#include "conduits/database/GroupComparison.h"
#include "conduits/database/RemovalChanges.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/Preferences.h"
#include "foundation/TestSwitch.h"
#include "model/Computers.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>

namespace rolvane {
namespace {

// From so many changed records on, a group's distribution choices are read at once.
constexpr size_t kMany = 16;

// Whatever such an identifier finds is a person, whose row is all that is needed of it.
bool namesPerson(const UniqueId& uid) {
    return uid.endsWith("Person");
}

// As an edited contact makes them, and no comparison of an all-contacts group.
bool isOfOnePerson(const CXDChangeRecordPtr& record) {
    return record->type() == CXDUpdateRecord || record->type() == CXDUpdateDistributionList;
}

template <class GroupClass>
CXSearchElement groupsModifiedAfter(Date date) {
    return GroupClass::searchElementForProperty(kCXModificationDateProperty, "", "", date, kCXGreaterThan);
}

} // namespace

CXDCXConduit::CXDCXConduit(ConduitEngine& engine, Collaborators with) : CXDConduit(engine), _with(std::move(with)) {
    setKillSwitch();
    _databaseChanged =
        _with.notifications.observe(kCXDatabaseChangedExternallyNotificationPriv,
                                    [this](const Notification& notification) { rolvaneChanged(notification); });
}

CXDCXConduit::~CXDCXConduit() = default;

std::optional<std::string> CXDCXConduit::conduitID() const {
    return kConduitCX;
}

int32_t CXDCXConduit::conduitSource() const {
    return CXDSyncSourceCX;
}

void CXDCXConduit::setKillSwitch() {
    const auto writers = rolvane().allGroup()->multiValueForProperty(kCXReadWriteSharingACLProperty);
    _readOnlyKillSwitch = !writers || writers->empty();
}

Dictionary CXDCXConduit::priorState() const {
    return engine().conduitObjectForKey(kConduitCX, kPriorState);
}

const std::string& CXDCXConduit::ownProgram() const {
    return _with.program.empty() ? rolvane().programName() : _with.program;
}

ChangeCapture CXDCXConduit::newCapture() const {
    return {engine(), rolvane(), priorState(), ownProgram()};
}

// -- a pass

void CXDCXConduit::open() {
    _lastSyncDate = _with.preferences.get(kDaemonDomain, kLastSyncDateKey).date().value_or(Date::distantPast());
    _scan.reset();
    _takesIn = false;
    _isOneOfSeveral = isOneOfSeveral(_with.preferences);
    _publishers.clear();
    // A trickle pass has gathered before it opens the conduits.
    const int64_t now = rolvane().journalPosition();
    _editsKnown = _captured != 0 ? _captured : now;
    _uncaptured.clear();
}

void CXDCXConduit::close() {
    rolvane().save();
    CXDConduit::close();
    _captured = 0;
    _written.clear();
    if (_takesIn) return; // the next scan looks behind the same date
    _lastSyncDate = _with.clock.now();
    _with.preferences.set(kDaemonDomain, kLastSyncDateKey, *_lastSyncDate);
    _with.preferences.synchronize(kDaemonDomain);
    if (_scan) {
        rolvane().advanceCursorTo(_scan->journalPosition, _scan->since);
        _lastScan = _scan->journalPosition;
    }
    _scan.reset();
}

CXDChangeRecords CXDCXConduit::changeRecords() {
    engine().checkCXShareCount();
    _takesIn = isTakingIn(engine(), _with.preferences, rolvane());
    if (_takesIn) return {};
    const Date since = _lastSyncDate.value_or(Date::distantPast());
    const bool hasTakenIn = scansAfterTakingIn(engine());
    const bool everything = forgetWhatIsPublishedAgain();
    // The journal's end and the rows are of one moment: a save is either before both or behind both.
    const CXRolvane::OneMoment moment(rolvane());
    const Scan scan{rolvane().journalPosition(), since};
    const Date ownSince = everything || hasTakenIn ? Date::distantPast() : since;
    const auto states = engine().stateGeneration();
    const auto now = states ? std::optional(Moment{scan.journalPosition, *states}) : std::nullopt;
    const bool isAsBefore = now && !everything && _foundNothing && now->states == _foundNothing->states &&
                            areEditsOfPeopleAlone(rolvane(), _foundNothing->journal, now->journal);

    ChangeCapture capture = newCapture();
    capture.reader().expectMany();
    std::unordered_set<UniqueId> groups;
    for (const CXSearchElement& modified :
         {groupsModifiedAfter<CXGroup>(ownSince), groupsModifiedAfter<CXSubscribedGroup>(since)})
        for (const CXRecordRef& record : rolvane().recordsMatchingSearchElement(modified)) {
            const auto group = std::dynamic_pointer_cast<CXGroup>(record);
            if (!group) continue; // found by a damaged index
            capture.addGroup(group);
            groups.insert(group->uniqueId());
        }
    if (!isLeftOut("groups of the journal")) addGroupsOfTheJournal(capture, scan, std::move(groups));
    addUnsettledGroups(capture);
    addUnsettledPeople(capture);
    rolvane().forEachPersonModifiedSince(ownSince, kCXPersonTable, [&](const CXRow& person) {
        if (everything || person.writer != ownProgram()) capture.addPerson(person, true);
    });
    rolvane().forEachPersonModifiedSince(since, kCXSubscribedPersonTable, [&](const CXRow& person) {
        if (person.writer != ownProgram()) capture.addPerson(person, true);
    });
    // Edits that were captured once and are not sent: the queue has them, or has lost them to its own rules. The
    // journal still delivers those that were saved while the last pass ran.
    std::unordered_set<UniqueId> delivered;
    if (_lastScan != 0)
        for (const UniqueId& changed : rolvane().changedByOthers(_lastScan, scan.journalPosition))
            delivered.insert(changed);
    for (const UniqueId& edited : rolvane().editedSinceCommon()) {
        if (delivered.contains(edited)) continue;
        const auto person = rolvane().personRow(edited);
        if (person && (person->modified <= since || person->writer == ownProgram())) capture.addPerson(*person, true);
    }
    if (!isAsBefore) addAllGroups(capture);

    _scan = scan;
    _editsKnown = scan.journalPosition;
    CXDChangeRecords records = capture.take();
    const bool foundNothing = std::all_of(records.begin(), records.end(), isOfOnePerson);
    _foundNothing = foundNothing ? now : std::nullopt;
    return records;
}

// Each takes as long as it has members.
void CXDCXConduit::addAllGroups(ChangeCapture& capture) {
    for (const CXSubscriptionRef& subscription : rolvane().subscriptions())
        if (subscription->_isAll() && saysSomething(*subscription))
            capture.addGroup(rolvane().allGroupForRemoteLocation(subscription->remoteLocation()));
    capture.addGroup(rolvane().allGroup());
}

std::optional<CXDChangeRecords> CXDCXConduit::changesOfGroupNow(const UniqueId& uid) {
    const std::shared_ptr<CXGroup> group =
        uid.str() == kCXAllGroupUID
            ? rolvane().allGroup()
            : std::dynamic_pointer_cast<CXGroup>(rolvane().recordForUniqueId(cxUIDWithTableName(uid, kCXGroupTable)));
    ChangeCapture capture = newCapture();
    const auto location = group ? capture.reader().locationOfGroup(*group) : std::nullopt;
    // Of one that is shared nowhere by itself, as the all-contacts group where single groups are published.
    if (!location || engine().userForRemoteLocation(*location) != kSelf) return std::nullopt;
    capture.addGroup(group);
    return capture.take();
}

// The owner's tree has lost what it held: nothing of it counts as known any more, so that all of it is new. Of several
// computers each still knows which tree it is: another one may withdraw it meanwhile.
bool CXDCXConduit::forgetWhatIsPublishedAgain() {
    Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    if (again.empty() || again[kSelf.str()].boolean()) return false;
    again.set(kSelf.str(), true);
    Dictionary onStore = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const Value serial = onStore[kSelf.str()].dictionary()[kSerialNumber];
    onStore.remove(kSelf.str());
    if (_isOneOfSeveral && serial.isString()) onStore.set(kSelf.str(), Dictionary{{kSerialNumber, serial}});
    engine().conduitObjectForKey(kConduitCX, kPriorState).remove(kSelf.str());
    return true;
}

// The all-contacts group of a subscription by which nothing has come yet is the framework's doing and nobody's edit.
// Taken for a new group it would be written to the publisher's store, and wait for ever where that may not be written.
bool CXDCXConduit::saysSomething(const CXSubscription& subscription) const {
    const RemoteLocation location = subscription.remoteLocation();
    if (priorState()[engine().userForRemoteLocation(location).str()].dictionary().contains(layout::kAllGroup))
        return true;
    const CXAllGroupRef group = rolvane().allGroupForRemoteLocation(location);
    return group && (group->memberCount() > 0 || !group->subgroupUniqueIds().empty());
}

// Groups that were saved while the last pass ran, dated before its end. The journal delivers them behind this pass, by
// when a change from the store may have taken the place of theirs.
void CXDCXConduit::addGroupsOfTheJournal(ChangeCapture& capture, const Scan& scan, std::unordered_set<UniqueId> added) {
    for (const UniqueId& uid : rolvane().changedByOthers(rolvane().cursorPosition(), scan.journalPosition)) {
        const std::string_view table = cxTableName(uid);
        if ((table == kCXGroupTable || table == kCXSubscribedGroupTable) && added.insert(uid).second)
            capture.addGroup(std::dynamic_pointer_cast<CXGroup>(rolvane().recordForUniqueId(uid)));
    }
}

// Groups that a former pass may have left on the store in an older state, or left there although they are gone.
// (All-contacts groups are compared anyway.)
void CXDCXConduit::addUnsettledGroups(ChangeCapture& capture) {
    const Dictionary unsettled = engine().conduitObjectForKey(kConduitCX, kUnsettledGroups);
    engine().setConduitObjectForKey(kConduitCX, Dictionary(), kUnsettledGroups);
    AbsenceCheck absences(rolvane());
    for (const auto& [identifier, isSo] : unsettled) {
        bool isThere = identifier == kCXAllGroupUID;
        for (const std::string_view table : {kCXGroupTable, kCXSubscribedGroupTable}) {
            const UniqueId uid = cxUIDWithTableName(UniqueId(identifier), table);
            if (const auto group = std::dynamic_pointer_cast<CXGroup>(rolvane().recordForUniqueId(uid))) {
                capture.addGroup(group);
                isThere = true;
            }
        }
        if (isThere) continue;
        for (const std::string_view table : {kCXGroupTable, kCXSubscribedGroupTable})
            absences.requireGone(cxUIDWithTableName(UniqueId(identifier), table));
        capture.add(changesToRemoveGroup(cxUIDWithTableName(UniqueId(identifier), kCXGroupTable)));
    }
}

// The owner's people whose contact the store has refused.
void CXDCXConduit::addUnsettledPeople(ChangeCapture& capture) {
    const Dictionary unsettled = engine().conduitObjectForKey(kConduitCX, kUnsettledPeople);
    engine().setConduitObjectForKey(kConduitCX, Dictionary(), kUnsettledPeople);
    for (const std::string& identifier : unsettled.allKeys()) {
        const UniqueId uid(identifier);
        if (const auto person = rolvane().personRow(uid)) {
            capture.addPerson(*person, true);
            continue;
        }
        auto removal = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDDeleteRecord, kSelf, uid, std::nullopt);
        removal->setAppliesToSources(CXDSyncSourceVaultra);
        capture.add({std::move(removal)});
    }
}

// -- other processes' saves

void CXDCXConduit::rolvaneChanged(const Notification& notification) {
    engine().updateStateAndExitIfNeeded();
    if (notification.userInfo[kCXSenderProcessID].integer() == _with.processID) return;
    engine().checkCXShareCount();
    if (isTakingIn(engine(), _with.preferences, rolvane())) return engine().bringSourcesUpToDate(); // scanned later
    _captured = rolvane().journalPosition();

    const Array inserted = notification.userInfo[kCXInsertedRecords].array();
    const Array updated = notification.userInfo[kCXUpdatedRecords].array();
    ChangeCapture capture = newCapture();
    try {
        if (inserted.count() + updated.count() >= kMany) capture.reader().expectMany();
        captureInserted(capture, inserted);
        captureReplaced(capture, inserted);
        captureUpdated(capture, updated);
        captureDeleted(capture, notification.userInfo[kCXDeletedRecords].array());
    } catch (const CXDamagedDatabase&) {
        engine().bringSourcesUpToDate(); // which repairs it; what was to be told here stays in the journal
        throw;
    }

    const CXDChangeRecords records = capture.take();
    if (records.empty())
        engine().syncPrefs();
    else
        engine().applyChangeRecords(records);
    _captured = 0;
}

void CXDCXConduit::captureInserted(ChangeCapture& capture, const Array& identifiers) {
    for (const Value& identifier : identifiers) {
        const UniqueId uid(identifier.string());
        if (namesPerson(uid))
            capture.addPerson(capture.reader().personForUniqueId(uid), false);
        else
            capture.addGroup(std::dynamic_pointer_cast<CXGroup>(recordForUniqueId(uid)));
    }
}

// Of an own record that was removed and made anew in one save only the insertion is told.
void CXDCXConduit::captureReplaced(ChangeCapture& capture, const Array& inserted) {
    const Dictionary all = priorState()[kSelf.str()].dictionary()[layout::kAllGroup].dictionary();
    const Array people = all[kMemberUIDState].array(), groups = all[kSubgroupUIDState].array();
    std::vector<UniqueId> replaced;
    for (const Value& identifier : inserted)
        if (people.containsString(identifier.string()) || groups.containsString(identifier.string()))
            replaced.emplace_back(identifier.string());
    if (replaced.empty()) return;
    const RemovalChanges removals(priorState(), replaced.size());
    for (const UniqueId& uid : replaced) captureWhatListed(capture, removals, uid);
}

void CXDCXConduit::captureUpdated(ChangeCapture& capture, const Array& identifiers) {
    for (const Value& identifier : identifiers) {
        const UniqueId uid(identifier.string());
        if (namesPerson(uid)) {
            capture.addPerson(capture.reader().personForUniqueId(uid), true);
            continue;
        }
        const CXRecordRef record = recordForUniqueId(uid);
        if (const auto contents = std::dynamic_pointer_cast<CXGroupContents>(record))
            // The very group whose contents changed, not a subscribed copy of it.
            capture.addGroup(std::dynamic_pointer_cast<CXGroup>(rolvane().recordForUniqueId(contents->nts_GroupUID())));
        else if (std::dynamic_pointer_cast<CXInfo>(record))
            capture.addGroup(rolvane().allGroup());
        else
            capture.addGroup(std::dynamic_pointer_cast<CXGroup>(record));
    }
}

void CXDCXConduit::captureDeleted(ChangeCapture& capture, const Array& identifiers) {
    std::vector<UniqueId> deleted;
    for (const Value& identifier : identifiers) deleted.emplace_back(identifier.string());
    // First: what a revocation forgets must not be withdrawn from its publisher's store.
    lookForRevokedSubscriptions(deleted);
    const RemovalChanges removals(priorState(), deleted.size());
    for (const UniqueId& identifier : deleted) {
        const UniqueId normalized = cxNormalizedUID(identifier);
        if (rolvane().recordForUniqueId(identifier)) { // it is here again: undone, or another subscription brought it
            if (identifier == normalized) captureWhatListed(capture, removals, identifier);
            continue;
        }
        if (normalized.endsWith(kCXGroupTable))
            capture.add(removals.changesToRemoveGroup(normalized));
        else if (normalized.endsWith(kCXPersonTable))
            capture.add(removals.changesToRemovePerson(normalized));
    }
}

// The owner's groups that it was in: it came back without its places there.
void CXDCXConduit::captureWhatListed(ChangeCapture& capture, const RemovalChanges& removals, const UniqueId& uid) {
    const bool isGroup = uid.endsWith(kCXGroupTable);
    for (const CXDChangeRecordPtr& removal :
         isGroup ? removals.changesToRemoveGroup(uid) : removals.changesToRemovePerson(uid)) {
        const int32_t type = removal->type();
        if (removal->user() == kSelf && (type == CXDRemoveRecordFromGroup || type == CXDRemoveGroupFromGroup))
            capture.addGroup(std::dynamic_pointer_cast<CXGroup>(rolvane().recordForUniqueId(*removal->group())));
    }
}

void CXDCXConduit::lookForRevokedSubscriptions(const std::vector<UniqueId>& deleted) {
    for (const UniqueId& identifier : deleted) {
        if (!identifier.endsWith(kCXSubscriptionTable)) continue;
        if (const auto location = engine().remoteLocationForSubscriptionUID(identifier))
            engine().revokeRemoteLocation(*location, identifier);
    }
}

// -- single generators

CXDChangeRecords CXDCXConduit::changesForPerson(const std::shared_ptr<CXPerson>& person, bool update) {
    ChangeCapture capture = newCapture();
    if (person) capture.addPerson(rolvane().personRow(person->uniqueId()), update);
    return capture.take();
}

CXDChangeRecords CXDCXConduit::changesForGroup(const std::shared_ptr<CXGroup>& group) {
    ChangeCapture capture = newCapture();
    capture.addGroup(group);
    return capture.take();
}

CXDChangeRecords CXDCXConduit::compareGroupPriorStateToCurrentState(const Value& prior, const Value& current,
                                                                    const UniqueId& guid,
                                                                    const RemoteLocation& location) {
    ChangeCapture capture = newCapture();
    capture.addComparison(prior, current, guid, location, nullptr);
    return capture.take();
}

CXDChangeRecords CXDCXConduit::compareDistributionPriorStateToCurrentState(const Value& prior, const Value& current,
                                                                           const UniqueId& guid, const UserName& user,
                                                                           int32_t sources) {
    return compareDistributionStates(prior.dictionary(), current.dictionary(), {guid, user, sources, std::nullopt});
}

Dictionary CXDCXConduit::currentDistributionListStateForGroup(const std::shared_ptr<CXGroup>& group) {
    return ContactReader::distributionListState(*group);
}

CXDChangeRecords CXDCXConduit::distributionListChangesForPerson(const std::shared_ptr<CXPerson>& person,
                                                                int32_t sources, const UserName& user) {
    ChangeCapture capture = newCapture();
    if (const auto row = rolvane().personRow(person->uniqueId())) capture.addDistributionLists(*row, sources, user);
    return capture.take();
}

CXDChangeRecords CXDCXConduit::changesToRemovePerson(const UniqueId& person) {
    return RemovalChanges(priorState()).changesToRemovePerson(person);
}

CXDChangeRecords CXDCXConduit::changesToRemoveGroup(const UniqueId& group) {
    return RemovalChanges(priorState()).changesToRemoveGroup(group);
}

CXDChangeRecords CXDCXConduit::generateChangeRecordsToRevokeGroupUID(const UniqueId& group) {
    auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDDeleteGroup, kSelf, std::nullopt,
                                                    cxUIDWithTableName(group, kCXGroupTable));
    record->setAppliesToSources(engine().sourcesForGUID(group));
    return {std::move(record)};
}

CXRecordRef CXDCXConduit::recordForUniqueId(const UniqueId& uid) {
    return ContactReader(rolvane()).recordForUniqueId(uid);
}

int32_t CXDCXConduit::sourcesFromRemoteLocations(const CXMultiValue& locations) const {
    int32_t sources = 0;
    for (const auto& entry : locations.entries())
        sources |= syncSourceForRemoteLocation(RemoteLocation(entry.value.string()));
    return sources;
}

} // namespace rolvane
