// The half of the conduit base that looks at a store: what it holds now, and what that changes.

#include "conduits/CXDConduit.h"
#include "conduits/PublishedLayout.h"
#include "conduits/TakingIn.h"
#include "conduits/store/ComputersOnStore.h"
#include "conduits/store/StoreComparison.h"
#include "conduits/store/TreeCondition.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/Log.h"
#include "foundation/Preferences.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/files/CXFileManager.h"

#include <algorithm>

namespace rolvane {
namespace {

constexpr int kForbidden = 403;
constexpr int kNotFound = 404;
constexpr std::string_view kGroupSuffix = "CXGroup";
constexpr std::string_view kPersonSuffix = "CXPerson";

// Fit for a log: a hostile name may be long and hold anything.
std::string shown(const std::string& name) {
    constexpr size_t kShown = 80;
    return Url::percentEncodeComponent(std::string_view(name).substr(0, kShown));
}

std::string nameOf(const std::string& path, const FileInfo& info) {
    if (!info.displayName.empty()) return info.displayName;
    const std::string_view text = std::string_view(path).substr(0, path.find_last_not_of('/') + 1);
    return std::string(text.substr(text.rfind('/') + 1));
}

// The groups of a listing that have to be read are, all at once, for as long as this lives. Large lists are read when
// it is their turn.
class ReadingGroupsAhead {
public:
    ReadingGroupsAhead(CXFileManager& manager, const Url& base, const FileListing& listing) : _manager(manager) {
        constexpr uint64_t kLarge = 256u << 10;
        std::vector<Url> groups;
        for (const auto& [path, file] : listing) {
            const std::string name = nameOf(path, file);
            if (name.ends_with(kGroupSuffix) && layout::isASoundName(name) && file.modificationdate && !file.seen &&
                file.size < kLarge)
                groups.push_back(base.cxURLByAppendingComponent(name));
        }
        if (groups.size() < 2) return;
        _expecting = true;
        _manager.expectReads(groups, false);
    }
    ~ReadingGroupsAhead() {
        if (_expecting) _manager.expectReads({}, false);
    }
    ReadingGroupsAhead(const ReadingGroupsAhead&) = delete;
    ReadingGroupsAhead& operator=(const ReadingGroupsAhead&) = delete;

private:
    CXFileManager& _manager;
    bool _expecting = false;
};

// The contacts of a part of a listing are going to be read.
void expectContacts(CXFileManager& manager, const Url& base, const FileListing& part) {
    std::vector<Url> contacts;
    for (const auto& [path, file] : part) {
        const std::string name = nameOf(path, file);
        if (name.ends_with(kPersonSuffix) && layout::isASoundName(name) && file.modificationdate &&
            file.size <= layout::kLargestFile)
            contacts.push_back(layout::contactLocation(base, UniqueId(name)));
    }
    manager.expectSomeReads(contacts, true); // payloads are read securely
}

Array arrayOf(const std::vector<UserName>& principals) {
    Array all;
    for (const UserName& principal : principals) all.append(principal);
    return all;
}

} // namespace

// -- the snapshot

std::vector<RemoteLocation> CXDConduit::locationsToRead() {
    std::vector<RemoteLocation> locations;
    const Dictionary prior = _engine.conduitObjectForKey(*conduitID(), kPriorState);
    if (prior.contains(kSelf.str()))
        if (const auto own = baseLocationForUser(realUserFromUser(kSelf)))
            locations.emplace_back(own->absoluteString());
    preferences().synchronize(kApplicationDomain);
    for (const CXSubscriptionRef& subscription : database().subscriptions()) {
        const RemoteLocation location = subscription->remoteLocation();
        if (syncSourceForRemoteLocation(location) != conduitSource()) continue;
        locations.push_back(location);
        _engine.setRemoteLocationForSubscriptionUID(location, subscription->uniqueId());
    }
    return locations;
}

Dictionary CXDConduit::currentState() {
    Dictionary state;
    _changedAlone.clear();
    if (!conduitID() || conduitSource() == 0) return state; // no source of its own
    for (const RemoteLocation& location : locationsToRead()) readLocation(location, state);
    return state;
}

void CXDConduit::readLocation(const RemoteLocation& location, Dictionary& state) {
    const UserName user = _engine.userForRemoteLocation(location);
    // A location that names nobody cannot be read.
    if (user.empty() || state.contains(user.str()) || _changedAlone.contains(user)) return;
    const auto base = baseLocationForUser(realUserFromUser(user));
    if (!base) return;
    if (auto contacts = contactsChangedAlone(user, *base)) {
        _changedAlone.emplace(user, *std::move(contacts));
        return _engine.treeWasLookedAt(user, TreeLook::read);
    }
    bool forbidden = true;
    const bool isNew = !_engine.conduitObjectForKey(*conduitID(), kPriorState).contains(user.str());
    const auto userState = fetchWorkingState(*base, &forbidden, isNew && user != kSelf);
    if (forbidden) {
        if (user == kSelf) ownPublicationEnds(*base, false);
        const CXSubscriptionRef subscription = database().findSubscriptionWithRemoteLocation(location);
        _engine.revokeRemoteLocation(location, subscription ? std::optional(subscription->uniqueId()) : std::nullopt);
        removeRecordsAssociateWithRemoteLocation(location);
    }
    if (!userState) return _engine.treeWasLookedAt(user, forbidden ? TreeLook::ended : TreeLook::notRead);
    if (!isTrusted(user, *userState)) return _engine.treeWasLookedAt(user, TreeLook::leftAlone);
    // Without a serial number nothing of it counts.
    _engine.treeWasLookedAt(user, (*userState)[kSerialNumber].isString() ? TreeLook::read : TreeLook::notRead);
    if (!userState->contains(layout::kAllGroup))
        Dictionary(*userState).set(layout::kAllGroup, listOfAllThatLiesThere(*userState));
    state.set(user.str(), *userState);
}

bool CXDConduit::isTrusted(const UserName& /*user*/, const Dictionary& /*state*/) {
    return true;
}

std::optional<Dictionary> CXDConduit::fetchWorkingStateForSubscription(const Url& base, bool* forbidden) {
    return fetchWorkingState(base, forbidden, false);
}

std::optional<Dictionary> CXDConduit::fetchWorkingState(const Url& base, bool* forbidden, bool allIsNew) {
    if (forbidden) *forbidden = false;
    CXFileManager* manager = defaultManager();
    if (!manager) return std::nullopt;
    Dictionary state, people;
    state.dictionaryFor(kPeopleState).set(kMemberUIDState, people);
    int code = 0;
    const auto info = manager->dictionaryAtURL(base.cxURLByAppendingComponent(layout::kInfo), &code, false);
    if (forbidden) {
        *forbidden = code == kNotFound || code == kForbidden;
        if (*forbidden) return std::nullopt;
    }
    if (info)
        if (const Value serial = (*info)[kSerialNumber]) state.set(kSerialNumber, serial);

    // Without a serial number nothing is read of the tree.
    const auto listing = allIsNew && state[kSerialNumber].isString()
                             ? manager->infoForFilesInContainerByParts(
                                   base, [&](const FileListing& part) { expectContacts(*manager, base, part); })
                             : manager->infoForFilesInContainer(base);
    if (!listing) {
        CXLog("Could not retrieve info for files in subscription: %@", base);
        return std::nullopt;
    }
    const ReadingGroupsAhead ahead(*manager, base, *listing);
    const std::string infoPath = base.cxURLByAppendingComponent(layout::kInfo).path();
    const std::string clockPath = layout::dateFileLocation(base).path();
    const std::string computersPath = base.cxURLByAppendingComponent(ComputersOnStore::kFile).path();
    const std::string bucketsPath = base.cxURLByAppendingComponent(layout::kPeople).path() + "/";
    for (const auto& [path, file] : *listing) {
        const std::string name = nameOf(path, file);
        if (file.stored && (path == infoPath || path == clockPath))
            state.dictionaryFor(kTreeDates).set(name, *file.stored);
        if (file.stored && path == computersPath)
            state.set(ComputersOnStore::kFile, file.etag.empty() ? file.stored->toISO8601() : file.etag.str());
        if (isASpecialFile(name) || name == layout::kPeople) continue;
        const bool isGroup = name.ends_with(kGroupSuffix);
        if (!isGroup && !name.ends_with(kPersonSuffix)) continue;
        // Groups lie beside "People": what is called like one among the contacts could not be read as one.
        if (!layout::isASoundName(name) || (isGroup && path.starts_with(bucketsPath))) {
            CXLog("An entry with a strange name in %@ is left out: %@", base, shown(name));
        } else if (file.size > layout::kLargestFile) {
            CXLog("An entry in %@ is too large to be read and left out: %@", base, shown(name));
        } else if (isGroup) {
            Dictionary groupState;
            if (file.modificationdate) {
                groupState.set(kModificationDate, *file.modificationdate);
                if (!readGroup(base, name, groupState)) return std::nullopt;
            }
            state.set(name, groupState);
        } else if (file.modificationdate) {
            people.set(name, Dictionary{{kModificationDate, *file.modificationdate}});
        }
    }
    return state;
}

namespace {

// A list says what somebody has written into it. Names that no member can have are left out, with one line a list. One
// that is left with nothing counts as none: nobody has emptied it.
void leaveStrangeNamesOut(Dictionary& groupState, const Url& location) {
    size_t strange = 0;
    std::string example;
    for (const char* key : {kMemberUIDState, kSubgroupUIDState}) {
        const Array* listed = groupState[key].arrayIf();
        if (!listed) continue;
        Array sound;
        for (const Value& name : *listed) {
            if (layout::isASoundName(name.string()) && layout::isARecordsName(UniqueId(name.string())))
                sound.append(name);
            else if (++strange == 1)
                example = name.string();
        }
        if (sound.empty() && !listed->empty())
            groupState.remove(key);
        else if (sound.count() != listed->count())
            groupState.set(key, sound);
    }
    if (strange != 0)
        CXLog("%d strange names in the list %@ are left out, the first of them: %@", static_cast<int>(strange),
              location, shown(example));
}

} // namespace

bool CXDConduit::readGroup(const Url& base, const std::string& name, Dictionary& groupState) {
    const Url location = base.cxURLByAppendingComponent(name);
    int code = 0;
    const auto content = defaultManager()->dictionaryAtURL(location, &code, false);
    if (!content) {
        CXLog("Could not get group info at: %@, error: %d", location, code);
        return false;
    }
    groupState.addEntriesFrom(*content);
    leaveStrangeNamesOut(groupState, location);
    return true;
}

// -- the comparison

CXDChangeRecords CXDConduit::comparePriorStateToCurrentState(const Dictionary& prior, const Dictionary& current) {
    CXDChangeRecords records;
    std::vector<std::string> users = prior.allKeys(); // a cancelled user leaves the prior state on the way
    for (const std::string& user : current.allKeys())
        if (!prior.contains(user)) users.push_back(user);
    for (const std::string& user : users) compareUser(UserName(user), prior, current, records);
    return records;
}

void CXDConduit::compareUser(const UserName& user, const Dictionary& prior, const Dictionary& current,
                             CXDChangeRecords& records) {
    if (const auto alone = _changedAlone.find(user); alone != _changedAlone.end()) {
        const Url base = *baseLocationForUser(user);
        const auto lists = changeRecordsForACLAtRemoteLocation(base);
        records.insert(records.end(), lists.begin(), lists.end());
        if (alone->second.empty()) return;
        StoreUser who{user, RemoteLocation(base.absoluteString()), conduitSource(), false, _lastSyncDate, {}, {}};
        who.contactUpdate = [&](const UniqueId& contact) { return contactUpdate(user, who.base, contact); };
        Dictionary now;
        now.dictionaryFor(kPeopleState).set(kMemberUIDState, alone->second);
        const CXDChangeRecords changes = compareStoreStates({}, now, who);
        records.insert(records.end(), changes.begin(), changes.end());
        return;
    }
    const Dictionary now = current[user.str()].dictionary();
    const Value& serial = now[kSerialNumber];
    const auto base = baseLocationForUser(user); // of the user as it stands, "<self>" included
    if (!serial.isString() || !base) return;     // could not be read, or is no store of ours
    const RemoteLocation baseText(base->absoluteString());
    const Dictionary* known = prior[user.str()].dictionaryIf();
    Dictionary before = known ? *known : Dictionary();
    const Value knownSerial = before[kSerialNumber];
    if (knownSerial.isString() && knownSerial.string() != serial.string()) {
        if (user == kSelf) ownPublicationEnds(*base, true);
        cancelSharingTo(baseText);
        _engine.treeWasLookedAt(user, TreeLook::ended);
        return;
    }
    before.set(kSerialNumber, serial);
    const bool allIsNew = known == nullptr || known->contains(kAllIsNew);
    before.remove(kAllIsNew);

    const CXDChangeRecords lists = changeRecordsForACLAtRemoteLocation(*base);
    records.insert(records.end(), lists.begin(), lists.end());

    StoreUser who{user, baseText, conduitSource(), allIsNew, _lastSyncDate, {}, {}};
    who.mayWrite = [&] {
        const auto manager = ACLManagerForRemoteLocation(*base);
        if (!manager) return false;
        const std::vector<UserName>& writers = manager->principalsWithAllAccess();
        return std::find(writers.begin(), writers.end(), kSelf) != writers.end();
    };
    who.contactUpdate = [&](const UniqueId& contact) { return contactUpdate(user, baseText, contact); };
    const CXDChangeRecords changes = compareStoreStates(before, now, who);
    records.insert(records.end(), changes.begin(), changes.end());
}

CXDChangeRecordPtr CXDConduit::contactUpdate(const UserName& user, const RemoteLocation& base,
                                             const UniqueId& contact) const {
    Dictionary payload;
    UniqueId person = contact;
    if (user == kSelf) {
        unstamp(payload);
    } else {
        person = cxUIDWithTableName(contact, kCXSubscribedPersonTable);
        stampWithRemoteLocation(payload, base);
    }
    auto record = std::make_shared<CXDChangeRecord>(conduitSource(), CXDUpdateRecord, user, person, std::nullopt,
                                                    std::move(payload));
    record->packPayload(); // there may be very many, and few are looked into at a time
    record->setAppliesToSources(CXDSyncSourceCX);
    if (const auto location = locationForUID(contact, user)) record->setDelayedPayloadURL(*location, defaultManager());
    return record;
}

Dictionary CXDConduit::compareGroupPriorStateTo(const Value& prior, const Value& current) const {
    return groupDifference(prior, current);
}

Dictionary CXDConduit::comparePriorDistributionListToCurrentDistributionList(const Value& prior,
                                                                             const Value& current) const {
    return distributionListDifference(prior, current);
}

// -- access lists

CXDChangeRecords CXDConduit::changeRecordsForACLAtRemoteLocation(const Url& location) {
    CXDChangeRecords records;
    const auto manager = keepsAccessLists() ? ACLManagerForRemoteLocation(location) : nullptr;
    if (!manager || !manager->isKnown()) return records;
    const UserName user = _engine.userForRemoteLocation(RemoteLocation(location.absoluteString()));
    const Dictionary users = _engine.conduitObjectForKey(kConduitCX, kPriorState);
    const Dictionary prior = users[user.str()].dictionary()[layout::kAllGroup].dictionary();
    appendACLChange(CXDChangeGroupReadWriteACL, user, manager->principalsWithAllAccess(),
                    prior[kCXReadWriteSharingACLProperty], records);
    appendACLChange(CXDChangeGroupReadACL, user, manager->principalsWithReadAccess(), prior[kCXReadSharingACLProperty],
                    records);
    return records;
}

void CXDConduit::appendACLChange(CXDChangeType type, const UserName& user, const std::vector<UserName>& current,
                                 const Value& prior, CXDChangeRecords& records) const {
    const Dictionary difference = compareCurrentACLWithPriorACL(arrayOf(current), prior);
    if (difference[kAdditions].array().empty() && difference[kDeletions].array().empty()) return;
    auto record = std::make_shared<CXDChangeRecord>(conduitSource(), type, user, std::nullopt,
                                                    UniqueId(layout::kAllGroup), difference);
    record->setAppliesToSources(CXDSyncSourceCX);
    records.push_back(std::move(record));
}

Dictionary CXDConduit::compareCurrentACLWithPriorACL(const Value& current, const Value& prior) {
    return cxDifferencesBetweenArray(prior.array(), current.array());
}

} // namespace rolvane
