#include "conduits/local/CXDLocalConduit.h"

#include "conduits/PublishedLayout.h"
#include "contacts/records/CXGroup.h"
#include "contacts/records/Constants.h"
#include "foundation/Log.h"
#include "foundation/Preferences.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

#include <cstring>

namespace rolvane {
namespace {

constexpr mode_t kForEverybody = 0777;
constexpr std::string_view kPublishAll = "PublishAll";
constexpr std::string_view kLockFile = ".lock";
constexpr const char* kUIDState = "uidState"; // a group's members as keys, with empty dictionaries
constexpr const char* kAdds = "adds";
constexpr const char* kRemoves = "removes";

bool isAFileName(std::string_view name) {
    return !name.empty() && name.front() != '.' && name.find('/') == name.npos && name.find('\0') == name.npos;
}

std::shared_ptr<CXFileManager> managerFor(const std::string& root) {
    if (root != CXDLocalConduit::kRoot) return std::make_shared<CXFileManager>(root);
    static const auto processes = std::make_shared<CXFileManager>(std::string(CXDLocalConduit::kRoot));
    return processes;
}

// The group state after the change: a member that is there already keeps its value.
Dictionary stateAfter(const Dictionary& before, const Dictionary& payload) {
    Dictionary after = Value(before).deepMutableCopy().dictionary();
    Dictionary members = after.dictionaryFor(kUIDState);
    for (const Value& uid : payload[kAdds].array())
        if (!members.contains(uid.string())) members.set(uid.string(), Dictionary());
    for (const Value& uid : payload[kRemoves].array()) members.remove(uid.string());
    if (const Value& name = payload[kCXGroupNameProperty]) after.set(kCXGroupNameProperty, name);
    return after;
}

} // namespace

CXDLocalConduit::CXDLocalConduit(ConduitEngine& engine, Collaborators with)
    : CXDConduit(engine), _with(std::move(with)), _files(_with.root), _manager(managerFor(_with.root)) {}

CXDLocalConduit::~CXDLocalConduit() = default;

std::optional<std::string> CXDLocalConduit::conduitID() const {
    return kConduitLocal;
}

std::optional<UserName> CXDLocalConduit::realUserFromUser(const std::optional<UserName>& user) const {
    return user == kSelf ? _with.login : user;
}

int32_t CXDLocalConduit::conduitSource() const {
    return CXDSyncSourceLocal;
}

CXFileManager* CXDLocalConduit::defaultManager() const {
    return _manager.get();
}

std::optional<Url> CXDLocalConduit::baseLocationForUser(const std::optional<UserName>& user) const {
    if (!user || !isAFileName(user->str())) return std::nullopt;
    return Url::fileURL(_with.root).cxURLByAppendingComponent(user->str());
}

std::string CXDLocalConduit::lockPath() const {
    return _with.root + "/" + std::string(kLockFile);
}

void CXDLocalConduit::open() {
    engine().lockURL(Url::fileURL(lockPath())); // who does not get the lock reads all the same
    _lastSyncDate = _with.preferences.get(kDaemonDomain, kLastSyncDateKey).date().value_or(Date::distantPast());
}

void CXDLocalConduit::close() {
    CXDConduit::close();
    _lastSyncDate = _with.clock.now();
    _with.preferences.set(kDaemonDomain, kLastSyncDateKey, *_lastSyncDate);
    _with.preferences.synchronize(kDaemonDomain);
}

// -- applying

bool CXDLocalConduit::applyChangeRecord(const CXDChangeRecordPtr& record, bool* /*denied*/) {
    // Identifiers also come out of other people's lists: one that names the tree's own files would destroy those.
    for (const auto& name : {record->person(), record->group()})
        if (name && !layout::isARecordsName(*name)) return false;
    switch (record->type()) {
    case CXDUpdateRecord: return updateRecord(*record);
    case CXDCreateStructureForGroup: return createStructureForGroup(*record);
    case CXDCompositeGroupChange: return makeCompositeGroupChange(*record);
    case CXDChangeGroupName: return changeGroupName(*record);
    case CXDAddRecordToGroup: return addRecordToGroup(*record);
    case CXDChangeGroupReadACL:
    case CXDChangeGroupReadWriteACL: return true; // the folder is everybody's
    case CXDRemoveRecordFromGroup: return removeRecordFromGroup(*record);
    case CXDDeleteGroup: return deleteGroup(*record);
    default: return false; // a deleted contact stays, too
    }
}

std::optional<std::string> CXDLocalConduit::pathFor(const CXDChangeRecord& record,
                                                    std::initializer_list<std::string_view> below) const {
    const auto user = realUserFromUser(record.user());
    if (!user || !isAFileName(user->str())) return std::nullopt;
    std::string path = _with.root + "/" + user->str();
    for (const std::string_view name : below) {
        if (!isAFileName(name)) return std::nullopt;
        path += "/" + std::string(name);
    }
    return path;
}

// A state file in the way of the group's directory moves into it.
void CXDLocalConduit::makeGroupDirectory(const std::string& path) {
    if (_files.makeDirectories(path, kForEverybody) != ENOTDIR) return;
    const std::string aside = path + ".new";
    if (_files.rename(path, aside) != 0) return;
    _files.makeDirectories(path, kForEverybody);
    _files.rename(aside, path + "/" + CXDAVManager::kStateName);
}

bool CXDLocalConduit::updateRecord(CXDChangeRecord& record) {
    const auto people = pathFor(record, {layout::kPeople});
    const auto file = record.person() ? pathFor(record, {layout::kPeople, record.person()->str()}) : std::nullopt;
    if (!people || !file) return false;
    _files.makeDirectories(*people, kForEverybody);
    const int error = _files.write(*file, stringForDictionary(record.payload().dictionary()), kForEverybody);
    if (error != 0) CXLog("ERR: %s", std::strerror(error));
    return true;
}

bool CXDLocalConduit::createStructureForGroup(CXDChangeRecord& record) {
    const auto people = pathFor(record, {layout::kPeople});
    const auto group = record.group() ? pathFor(record, {record.group()->str()}) : std::nullopt;
    if (!people || !group) return false;
    _files.makeDirectories(*people, kForEverybody);
    makeGroupDirectory(*group);
    _files.write(*group + "/" + std::string(layout::kInfo), stringForDictionary(record.payload().dictionary()),
                 kForEverybody);
    return true;
}

bool CXDLocalConduit::addRecordToGroup(CXDChangeRecord& record) {
    if (!record.group() || !record.person()) return false;
    const auto people = pathFor(record, {layout::kPeople});
    const auto group = pathFor(record, {record.group()->str()});
    const auto marker = pathFor(record, {record.group()->str(), record.person()->str()});
    if (!people || !group || !marker) return false;
    _files.makeDirectories(*people, kForEverybody);
    makeGroupDirectory(*group);
    _files.write(*marker, layout::kMemberMarkerText, kForEverybody);
    return true;
}

bool CXDLocalConduit::removeRecordFromGroup(CXDChangeRecord& record) {
    if (!record.group() || !record.person()) return false;
    const auto marker = pathFor(record, {record.group()->str(), record.person()->str()});
    if (!marker) return false;
    _files.removeFile(*marker);
    return true;
}

bool CXDLocalConduit::changeGroupName(CXDChangeRecord& record) {
    const auto info = record.group() ? pathFor(record, {record.group()->str(), layout::kInfo}) : std::nullopt;
    if (!info) return false;
    // Without the dictionary there is nothing to rename in.
    auto dictionary = _manager->dictionaryAtURL(Url::fileURL(*info), nullptr, false);
    if (!dictionary) return true;
    dictionary->set(kCXGroupNameProperty, record.payload());
    _files.write(*info, stringForDictionary(*dictionary));
    return true;
}

bool CXDLocalConduit::makeCompositeGroupChange(CXDChangeRecord& record) {
    const auto group = record.group() ? pathFor(record, {record.group()->str()}) : std::nullopt;
    if (!group) return false;
    const Url location = Url::fileURL(*group);
    int code = 0;
    const Dictionary before = _manager->dictionaryAtURL(location, &code, false).value_or(Dictionary());
    if (code != 200 && code != 404) return true; // it is there and not ours to read: nothing takes its place
    _manager->write(stringForDictionary(stateAfter(before, record.payload().dictionary())), location, false);
    return true;
}

bool CXDLocalConduit::deleteGroup(CXDChangeRecord& record) {
    const auto group = record.group() ? pathFor(record, {record.group()->str()}) : std::nullopt;
    return group && _manager->removeDirectoryAndContentsAtURL(Url::fileURL(*group));
}

bool CXDLocalConduit::publishAllGroup(const CXDChangeRecord& record) {
    const auto path = pathFor(record, {kPublishAll});
    if (!path) return false;
    _files.makeDirectories(*path, kForEverybody);
    return true;
}

} // namespace rolvane
