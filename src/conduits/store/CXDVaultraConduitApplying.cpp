// The part of the network store's conduit that writes: one function for each kind of change record.

#include "conduits/store/CXDVaultraConduit.h"

#include "conduits/PublishedLayout.h"
#include "conduits/store/TreeCondition.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/PropertyList.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <utility>

namespace rolvane {
namespace {

constexpr int kOk = 200;
constexpr int kForbidden = 403;
constexpr int kMissing = 404;

// The contacts and groups that two lists of a group's change name, as the database names them.
std::vector<UniqueId> namedIn(const UserName& user, const Dictionary& payload, const char* people, const char* groups) {
    std::vector<UniqueId> named;
    for (const char* list : {people, groups})
        for (const Value& name : payload[list].array()) named.push_back(nameInDatabase(user, UniqueId(name.string())));
    return named;
}

// The payload, decoded for this one use where it stands encoded: the record keeps no tree of it.
Dictionary contentOf(CXDChangeRecord& record) {
    if (const auto encoded = record.encodedPayload()) return BinaryValue::decode(*encoded).dictionary();
    return record.payload().dictionary();
}

} // namespace

UniqueId nameInDatabase(const UserName& user, const UniqueId& shared) {
    const bool isPerson = shared.endsWith("Person");
    if (user == kSelf) return cxUIDWithTableName(shared, isPerson ? kCXPersonTable : kCXGroupTable);
    return cxUIDWithTableName(shared, isPerson ? kCXSubscribedPersonTable : kCXSubscribedGroupTable);
}

bool CXDVaultraConduit::lockStructureForRecord(const CXDChangeRecord& record) {
    awaitStructure();
    const auto base = baseLocationOf(record);
    return base && engine().lockURL(layout::dateFileLocation(*base));
}

bool CXDVaultraConduit::applyChangeRecord(const CXDChangeRecordPtr& record, bool* denied) {
    if (denied) *denied = false;
    if (_vaultraOffLine || isHeld(*record) || !lockStructureForRecord(*record)) return false;
    int code = 0;
    const bool applied = mayBeNamed(record) ? apply(*record, code) : true;
    if (denied) *denied = code == kForbidden;
    return applied;
}

// An owner who mends a tree writes the own versions over everything that lies there. So a writer's change waits for it.
bool CXDVaultraConduit::isHeld(const CXDChangeRecord& record) const {
    if (record.changeMadeByDataOwner()) return _ownTreeIsHeld;
    return record.user() && _leftAlone.contains(*record.user());
}

void CXDVaultraConduit::wasRefused(const CXDChangeRecord& record) {
    const bool isContact = record.type() == CXDUpdateRecord || record.type() == CXDDeleteRecord;
    const auto base = baseLocationOf(record);
    const bool isEdit = record.type() == CXDUpdateRecord && record.initialSource() == CXDSyncSourceCX;
    if (isEdit && record.person() && !record.changeMadeByDataOwner()) forgetEdit(record);
    if (isContact && base && record.person())
        _with.manager.forgetVersion(layout::contactLocation(*base, cxNormalizedUID(*record.person())));
}

// The store will never take this edit, so its version must not be merged with the edit.
void CXDVaultraConduit::forgetEdit(const CXDChangeRecord& record) {
    const UniqueId uid = inDatabase(record);
    if (const auto row = _with.rolvane.personRow(uid)) _with.rolvane.setCommonVersion(uid, row->encoded);
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

void CXDVaultraConduit::willWrite(const CXDChangeRecords& records) {
    _writes.beginPass();
    _newOnStore.beginPass(_newRecords);
    _inDoubt.clear();
    for (const CXReached& each : whatHadCome())
        if (!_lookedFor.contains(each.uniqueId)) _inDoubt.insert(each.uniqueId);
    noteNewRecords(records);
    for (const CXDChangeRecordPtr& record : records) {
        if (record->type() != CXDUpdateRecord || !(record->appliesToSources() & conduitSource()) || !record->person() ||
            !record->user() || !mergesInto(*record->user()))
            continue;
        if (const auto base = baseLocationOf(*record))
            _writes.willWrite(layout::contactLocation(*base, *record->person()), inDatabase(*record),
                              [&] { return contentOf(*record); });
    }
}

// A record that the list names already can only be deleted there by being taken out of it.
void CXDVaultraConduit::noteNewRecords(const CXDChangeRecords& records) {
    _newRecords.clear();
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    std::map<UserName, ListedNames> people;
    for (const UserName& user : _writtenInOrder)
        people.try_emplace(user, users[user.str()].dictionary(), kMemberUIDState);
    for (const CXDChangeRecordPtr& record : records) {
        const auto listed = record->user() ? people.find(*record->user()) : people.end();
        if (listed == people.end()) continue;
        if (record->type() == CXDUpdateRecord && record->person() &&
            !listed->second.contains(cxNormalizedUID(*record->person())))
            _newRecords.insert(inDatabase(*record));
        if (record->group() && !users[record->user()->str()].dictionary().contains(
                                   cxUIDWithTableName(*record->group(), kCXGroupTable).str()))
            _newRecords.insert(nameInDatabase(*record->user(), *record->group()));
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
                                     *base,
                                     [&] {
                                         const Dictionary list =
                                             engine().knownGroupState(kConduitVaultra, user, everybody);
                                         return list[kMemberUIDState].array().containsString(shared.str());
                                     },
                                     _newOnStore.isNamedAlone(inDatabase(record))};
    if (_inDoubt.contains(place.uniqueId) || !_writes.write(place, contentOf(record), code)) return false;
    if (place.wasNeverThere || _newRecords.contains(place.uniqueId))
        _newOnStore.wasPut(user, place.uniqueId, _with.clock.now());
    return true;
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
    return user != kSelf || (_isWrittenByOthers && !_isOlderCopy);
}

CXDChangeRecords CXDVaultraConduit::takeMerged() {
    CXDChangeRecords updates;
    for (const ContactWrites::Merged& merged : _writes.takeMerged()) {
        if (!_with.rolvane.personRow(merged.place.uniqueId)) continue; // deleted meanwhile, and so it stays
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
    return _with.manager.modDateForURL(layout::contactLocation(*base, cxNormalizedUID(*record.person())));
}

bool CXDVaultraConduit::createStructureForGroup(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    const UserName user = record.user().value_or(UserName());
    const UniqueId here = nameInDatabase(user, *record.group());
    if (_inDoubt.contains(here)) return false;
    // Whether the directory could be made shows in the write below it.
    _with.manager.createDirectoryAtAURL(layout::groupLocation(*base, *record.group()));
    const bool done =
        _with.manager.write(stringForDictionary(contentOf(record)), layout::groupInfoLocation(*base, *record.group()),
                            kSecureRecordWrites, &code);
    if (done && _newRecords.contains(here)) _newOnStore.wasPut(user, here, _with.clock.now());
    return done;
}

bool CXDVaultraConduit::makeCompositeGroupChange(CXDChangeRecord& record, int& code) {
    if (!record.user() || !record.group() || !_writtenInOrder.contains(*record.user()))
        return writeComposite(record, contentOf(record), code);
    const Dictionary payload = contentOf(record);
    const std::vector<UniqueId> named = namedIn(*record.user(), payload, kMemberAdds, kSubgroupAdds);
    const bool isList = record.group()->str() == layout::kAllGroup;
    const auto waits = [&](const UniqueId& uid) {
        return _inDoubt.contains(uid) || (!isList && _newOnStore.waitsForList(uid));
    };
    const UniqueId here = nameInDatabase(*record.user(), *record.group());
    const auto leave = [&] {
        if (!isList) return;
        _newOnStore.listWaits(named);
        _newOnStore.listWaits(namedIn(*record.user(), payload, kMemberRemoves, kSubgroupRemoves));
    };
    try {
        if (!waits(here) && std::none_of(named.begin(), named.end(), waits)) {
            if (isList) _newOnStore.willName(*record.user(), named, _with.clock.now());
            if (writeComposite(record, payload, code)) {
                if (_newRecords.contains(here)) _newOnStore.wasPut(*record.user(), here, _with.clock.now());
                return true;
            }
        }
    } catch (const CXException&) {
        leave();
        throw;
    }
    leave();
    return false;
}

bool CXDVaultraConduit::writeComposite(CXDChangeRecord& record, const Dictionary& payload, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    const Url location = layout::groupLocation(*base, *record.group());
    auto state = _with.manager.dictionaryAtURL(location, false, &code);
    if (!state && code == kMissing) {
        const bool isList = record.group()->str() == layout::kAllGroup;
        if (isList && !record.changeMadeByDataOwner()) return false; // it waits for its owner's
        // Another computer would take a list of one change alone for the removal of everybody else. So a list that was
        // lost names what the other one has put there, too.
        if (isList && _isOneOfSeveral && lastKnownState(record).empty()) {
            if (_lostList.empty()) return false;
            state = _lostList;
        }
        if (wasDeletedThere(record)) return true;
    }
    // A part alone would be taken for all of it.
    if (!state && (code == kMissing || code == kOk)) state = lastKnownState(record);
    const Dictionary changed = layout::groupStateAfterComposite(state.value_or(Dictionary()), payload);
    // A state that is there and could not be read is not replaced by a part of it: the client then sends no write, and
    // the answer to the read stands.
    int written = 0;
    const bool done = _with.manager.write(stringForDictionary(changed), location, kSecureRecordWrites, &written);
    code = written != 0 ? written : cxAfterQuestion(_with.manager, *base, code);
    return done;
}

// Somebody else may take a new record in and delete it again. Nobody does before a tree's first list.
bool CXDVaultraConduit::writesInOrder(const UserName& user) {
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const bool answer =
        mergesInto(user) && !users[user.str()].dictionary()[std::string(layout::kAllGroup)].dictionary().empty();
    if (answer) _writtenInOrder.insert(user);
    return answer;
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
    if (_with.manager.dictionaryAtURL(location, false, &code) || code != kMissing) return false;
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
    return _with.manager.write(stringForDictionary(layout::infoAfterRename(record.payload())),
                               layout::groupInfoLocation(*base, *record.group()), false, &code);
}

bool CXDVaultraConduit::addRecordToGroup(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group() || !record.person()) return false;
    return _with.manager.write(std::string(layout::kMemberMarkerText),
                               layout::memberMarkerLocation(*base, *record.group(), *record.person()), false, &code);
}

bool CXDVaultraConduit::deleteRecord(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.person() || _newOnStore.waitsForList(inDatabase(record))) return false;
    return _with.manager.removeFileAtURL(layout::contactLocation(*base, *record.person()), &code);
}

bool CXDVaultraConduit::deleteGroup(CXDChangeRecord& record, int& code) {
    const auto base = baseLocationOf(record);
    if (!base || !record.group()) return false;
    if (_newOnStore.waitsForList(nameInDatabase(record.user().value_or(UserName()), *record.group()))) return false;
    return _with.manager.removeFileAtURL(layout::groupLocation(*base, *record.group()), &code);
}

} // namespace rolvane
