// The access lists of the network store's conduit. They reach the store when the managers are saved at the end of a
// pass.

#include "conduits/store/CXDVaultraConduit.h"

#include "acl/CXDAVACLManager.h"
#include "conduits/PublishedLayout.h"
#include "conduits/UserAlert.h"
#include "conduits/store/EndedPublication.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "foundation/Log.h"
#include "foundation/Preferences.h"
#include "model/Computers.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

namespace rolvane {
namespace {

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

// The members that the store is known to hold of the record's group in that user's tree.
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
    const Dictionary unsaved = _with.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary();
    if (!_vaultraOffLine)
        for (const auto& [location, changes] : unsaved) // those of another account wait until it is back
            if (engine().userForRemoteLocation(RemoteLocation(location)) == kSelf)
                ACLManagerForRemoteLocation(Url(location));
    const bool done = CXDConduit::saveACLs();
    noteUnsavedAccessLists();
    return done;
}

void CXDVaultraConduit::noteUnsavedAccessLists() {
    const Dictionary before = _with.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary();
    Dictionary now = before.mutableCopy();
    if (_ACLManagerMap)
        for (const auto& [location, manager] : *_ACLManagerMap) {
            const Array changes = manager->unsaved();
            changes.empty() ? now.remove(location) : now.set(location, changes);
        }
    if (now == before) return;
    _with.preferences.set(kDaemonDomain, kUnsavedAccessListsKey, now.empty() ? Value() : Value(now));
    const auto own = baseLocationForUser(realUserFromUser(kSelf));
    auto ended = endedPublication(_with.preferences);
    if (!ended || ended->replaced || !own || now.contains(own->absoluteString())) return;
    ended->mayStillRead.clear();
    noteEndedPublication(_with.preferences, *ended);
}

bool CXDVaultraConduit::keepsAccessLists() const {
    return _with.manager.keepsAccessLists().value_or(false);
}

// Our rights on somebody else's tree may have changed since they were asked for; nothing of ours is lost with the
// answer.
void CXDVaultraConduit::forgetSubscribersRights() {
    if (_ACLManagerMap && keepsAccessLists())
        std::erase_if(*_ACLManagerMap, [](const auto& entry) { return !entry.second->publisher(); });
}

std::shared_ptr<CXACLManager> CXDVaultraConduit::ACLManagerForRemoteLocation(const Url& location) {
    if (auto known = CXDConduit::ACLManagerForRemoteLocation(location)) return known;
    const auto base = baseLocationForRemoteLocation(location);
    if (!base) return nullptr;
    std::shared_ptr<CXACLManager> manager;
    if (_with.makeACLManager)
        manager = _with.makeACLManager(*base, engine());
    else
        manager = std::make_shared<CXDAVACLManager>(*base, engine(), _with.manager);
    if (manager->publisher())
        manager->resume(
            _with.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary()[base->absoluteString()].array());
    _ACLManagerMap->insert_or_assign(base->absoluteString(), manager);
    return manager;
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
    if (!_with.rolvane.allGroup()->valueForProperty(kCXRemoteLocationProperty)) return; // by the owner's doing
    const Dictionary prior = engine().conduitObjectForKey(kConduitCX, kPriorState)[kSelf.str()].dictionary();
    const auto taken = [&](const char* property) {
        const auto listed = _with.rolvane.allGroup()->multiValueForProperty(property);
        return takenAway(prior, property, listed ? listed->_allValues() : Array());
    };
    const Array readers = taken(kCXReadSharingACLProperty), writers = taken(kCXReadWriteSharingACLProperty);
    const Dictionary unsaved = _with.preferences.get(kDaemonDomain, kUnsavedAccessListsKey).dictionary();
    EndedPublication ended{_with.clock.now(), replaced, {}, _isOneOfSeveral};
    isOneOfSeveralNoMore();
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    if (const Value& serial = users[kSelf.str()].dictionary()[kSerialNumber]; serial.isString() && !replaced)
        _with.preferences.set(kDaemonDomain, kCXDFormerTree, serial);
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
    noteEndedPublication(_with.preferences, ended);
    _with.alert.tell(noticeOf(ended));
}

} // namespace rolvane
