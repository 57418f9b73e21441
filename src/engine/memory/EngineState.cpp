#include "engine/memory/EngineState.h"

#include "engine/queue/RefusedChanges.h"
#include "foundation/CXException.h"
#include "foundation/KeyedArchive.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <map>
#include <tuple>
#include <utility>

namespace rolvane {

namespace {
constexpr const char* kSubscriptionMap = "subscriptionMap";
constexpr const char* kRecordClass = "CXDChangeRecord";

// The dates of a tree's own files, which every pass of its owner moves.
bool isOfDatesAlone(const std::string& row) {
    return row.ends_with("/TreeDates");
}
} // namespace

// Whether another process, or a change in memory that was never put, makes it worth to be read.
bool EngineState::isAsStored() {
    return !_putAll && _edition && _preferences.get(kDaemonDomain, kCXDStateEdition) == _edition &&
           stateRows(*_conduitData) == _stored;
}

Dictionary EngineState::loadedConduitData() {
    if (std::exchange(_isDropped, false) && _conduitData && !isAsStored()) _conduitData.reset();
    if (!_conduitData) {
        ++_generation;
        _edition = _preferences.get(kDaemonDomain, kCXDStateEdition);
        _stored.clear();
        for (const std::string& key : _preferences.keys(kDaemonDomain))
            if (isStateRow(key)) _stored.emplace(key, _preferences.get(kDaemonDomain, key));
        _putAll = false;
        _conduitData = joinedRows(_stored);
    }
    return *_conduitData;
}

Dictionary EngineState::conduitData() {
    const Lock guard(_lock);
    return loadedConduitData();
}

void EngineState::dropConduitData() {
    const Lock guard(_lock);
    _isDropped = true;
}

uint64_t EngineState::generation() {
    const Lock guard(_lock);
    loadedConduitData();
    return _generation;
}

void EngineState::withConduitData(const std::function<void(Dictionary&)>& use) {
    const Lock guard(_lock);
    Dictionary data = loadedConduitData();
    use(data);
}

Dictionary EngineState::conduitObjectForKey(const std::string& conduitID, const std::string& key) {
    const Lock guard(_lock);
    return loadedConduitData().dictionaryFor(conduitID).dictionaryFor(key);
}

void EngineState::setConduitObjectForKey(const std::string& conduitID, const Value& object, const std::string& key) {
    const Lock guard(_lock);
    loadedConduitData().dictionaryFor(conduitID).set(key, object);
}

void EngineState::putConduitData() {
    const Lock guard(_lock);
    put(stateRows(loadedConduitData()));
}

void EngineState::putConduitDataWith(const Dictionary& marks) {
    const Lock guard(_lock);
    Dictionary data = loadedConduitData().mutableCopy();
    Dictionary cx = data[kConduitCX].dictionary().mutableCopy();
    for (const auto& [key, before] : marks) {
        Dictionary both = before.dictionary().mutableCopy();
        both.addEntriesFrom(cx[key].dictionary());
        cx.set(key, both);
    }
    if (!marks.empty()) data.set(kConduitCX, cx);
    put(stateRows(data));
}

Dictionary EngineState::marks() {
    const Lock guard(_lock);
    const Dictionary cx = loadedConduitData()[kConduitCX].dictionary();
    Dictionary marks;
    for (const char* key : {kUnsettledGroups, kUnsettledPeople})
        if (!cx[key].dictionary().empty()) marks.set(key, cx[key].deepMutableCopy());
    return marks;
}

void EngineState::forgetPut() noexcept {
    const Lock guard(_lock);
    _putAll = true;
    ++_generation;
}

void EngineState::put(const StateRows& rows) {
    if (isLeftOut("states")) return;
    bool isAnother = false, isOther = false;
    const auto changes = [&](const std::string& row) {
        isAnother = true;
        isOther = isOther || !isOfDatesAlone(row);
    };
    if (_putAll) {
        _stored.clear();
        for (const std::string& key : _preferences.keys(kDaemonDomain))
            if (isStateRow(key)) _stored.emplace(key, Value()); // equal to none
        _putAll = false;
    }
    for (auto stored = _stored.begin(); stored != _stored.end();)
        if (rows.contains(stored->first)) {
            ++stored;
        } else {
            changes(stored->first);
            _preferences.remove(kDaemonDomain, stored->first);
            stored = _stored.erase(stored);
        }
    for (const auto& [key, value] : rows) {
        Value& stored = _stored[key];
        if (stored == value) continue;
        changes(key);
        _preferences.set(kDaemonDomain, key, value);
        stored = value.deepMutableCopy();
    }
    if (isOther) ++_generation;
    if (!isAnother) return;
    _edition = makeUUID();
    _preferences.set(kDaemonDomain, kCXDStateEdition, _edition);
}

void EngineState::syncPrefs() {
    putConduitData();
    _preferences.synchronize(kDaemonDomain);
}

CXDChangeRecords EngineState::getPendingChanges() const {
    CXDChangeRecords records;
    try {
        const Value stored = _preferences.get(kDaemonDomain, kCXDPendingChanges);
        if (!stored.isData()) return records;
        KeyedArchive::unarchive(stored.data(), [&](KeyedArchive::Object object) {
            if (object.className == kRecordClass)
                records.push_back(std::make_shared<CXDChangeRecord>(DictionaryCoder(std::move(object.keys))));
        });
    } catch (const CXException& e) {
        // What does not unarchive is no queue. A file that cannot be read just now is something else: its queue stays.
        if (e.name() == kCXPreferencesException || e.name() == kCXDatabaseException) throw;
        records.clear();
    }
    return records;
}

void EngineState::setPendingChanges(const CXDChangeRecords& records) {
    if (isLeftOut("queue")) return;
    const auto archived = [&](size_t i) {
        DictionaryCoder coder;
        records[i]->encodeWithCoder(coder);
        return KeyedArchive::Object{kRecordClass, coder.entries()};
    };
    _preferences.setData(kDaemonDomain, kCXDPendingChanges, KeyedArchive::archive(records.size(), archived));
    _preferences.synchronize(kDaemonDomain);
}

Dictionary EngineState::underWay() const {
    return isLeftOut("under way") ? Dictionary() : _preferences.get(kDaemonDomain, kCXDUnderWay).dictionary();
}

void EngineState::setUnderWay(const Dictionary& underWay) {
    _preferences.set(kDaemonDomain, kCXDUnderWay, underWay.empty() ? Value() : Value(underWay));
}

void EngineState::noteRefusedChanges(const std::vector<Refusal>& refusals, Date when) {
    constexpr size_t kKept = 20;
    std::map<std::tuple<std::string, std::string, std::string>, int64_t> alike;
    for (const Refusal& refusal : refusals) ++alike[{refusal.user.str(), refusal.why, refusal.group}];
    Array notes = _preferences.get(kDaemonDomain, kCXDRefusedChanges).array().mutableCopy();
    for (const auto& [of, changes] : alike) {
        const auto& [user, why, group] = of;
        Dictionary note{{kRefusedDate, when}, {kRefusedUser, user}, {kRefusedChanges, changes}};
        if (!why.empty()) note.set(kRefusedWhy, why);
        if (!group.empty()) note.set(kRefusedGroup, group);
        notes.append(note);
    }
    while (notes.count() > kKept) notes.removeAt(0);
    _preferences.set(kDaemonDomain, kCXDRefusedChanges, notes);
}

void EngineState::noteRefusedByOwnStore(size_t changes, std::optional<Date> when) {
    const Array before = _preferences.get(kDaemonDomain, kCXDRefusedChanges).array();
    Array notes;
    Value since = when ? Value(*when) : Value();
    for (const Value& note : before) {
        const Dictionary of = note.dictionary();
        if (of[kRefusedWhy] != Value(kRefusedByOwnStore))
            notes.append(note);
        else if (!when)
            since = of[kRefusedDate];
    }
    if (changes > 0 && since)
        notes.append(Dictionary{{kRefusedDate, since},
                                {kRefusedUser, kSelf},
                                {kRefusedChanges, static_cast<int64_t>(changes)},
                                {kRefusedWhy, kRefusedByOwnStore}});
    if (notes != before) _preferences.set(kDaemonDomain, kCXDRefusedChanges, notes);
}

void EngineState::noteRefused(const Refusal& refusal) {
    const Lock guard(_lock);
    _refused.push_back(refusal);
}

std::vector<Refusal> EngineState::takeRefused() {
    const Lock guard(_lock);
    return std::exchange(_refused, {});
}

void EngineState::setRemoteLocationForSubscriptionUID(const std::optional<RemoteLocation>& location,
                                                      const std::optional<UniqueId>& subscription) {
    if (!location || !subscription) return;
    const Lock guard(_lock);
    loadedConduitData().dictionaryFor(kSubscriptionMap).set(subscription->str(), *location);
}

std::optional<RemoteLocation> EngineState::remoteLocationForSubscriptionUID(const UniqueId& subscription) {
    const Lock guard(_lock);
    const Value map = loadedConduitData()[kSubscriptionMap];
    const Dictionary* locations = map.dictionaryIf();
    const std::string* location = locations ? (*locations)[subscription.str()].stringIf() : nullptr;
    return location ? std::optional(RemoteLocation(*location)) : std::nullopt;
}

void EngineState::removeSubscriptionMapForRemoteLocation(const RemoteLocation& location) {
    const Lock guard(_lock);
    const Value map = loadedConduitData()[kSubscriptionMap];
    if (!map.isDictionary()) return;
    Dictionary locations = map.dictionary();
    for (const std::string& subscription : locations.allKeys())
        if (locations[subscription] == Value(location)) locations.remove(subscription);
}

void EngineState::removeSubscription(const UniqueId& subscription) {
    const Lock guard(_lock);
    const Value map = loadedConduitData()[kSubscriptionMap];
    if (map.isDictionary()) map.dictionary().remove(subscription.str());
}

bool EngineState::isOfFormerSubscription(const RemoteLocation& location, const UniqueId& subscription) {
    const Lock guard(_lock);
    const Value map = loadedConduitData()[kSubscriptionMap];
    const Dictionary* locations = map.dictionaryIf();
    if (!locations || locations->contains(subscription.str())) return false;
    return std::any_of(locations->begin(), locations->end(),
                       [&](const auto& entry) { return entry.second == Value(location); });
}

void EngineState::forgetUser(const UserName& user) {
    if (user == kSelf) {
        withConduitData([](Dictionary& data) { forgetRefusedChanges(data); });
        noteRefusedByOwnStore(0, std::nullopt);
    }
    for (const char* conduit : {kConduitVaultra, kConduitCX})
        conduitObjectForKey(conduit, kPriorState).remove(user.str());
    Dictionary onTheWay = underWay().mutableCopy();
    if (onTheWay.contains(user.str())) {
        onTheWay.remove(user.str());
        setUnderWay(onTheWay);
    }
    CXDChangeRecords pending = getPendingChanges();
    if (std::erase_if(pending, [&](const CXDChangeRecordPtr& r) { return r->user() == user; }) > 0)
        setPendingChanges(pending);
}

void EngineState::claim(int64_t shareCount, const std::optional<UserName>& user) {
    if (isLeftOut("claim")) return;
    if (!_preferences.get(kDaemonDomain, kCXDShareCount)) _preferences.set(kDaemonDomain, kCXDShareCount, shareCount);
    if (user && !_preferences.get(kDaemonDomain, kCXDLastOstrelUser))
        _preferences.set(kDaemonDomain, kCXDLastOstrelUser, *user);
}

// Whose rights were taken away keeps to be sent: the access lists' changes belong to the account's tree, whatever
// database it is filled from.
void EngineState::reset() {
    CXDLog("Reset!");
    for (const char* key :
         {kCXDPendingChanges, kCXDConduitData, kCXDVaultraConduitLastSyncDate, kCXDCXConduitLastSyncDate,
          kCXDLocalConduitLastSyncDate, kCXDShareCount, kCXDLastOstrelUser, kCXDUnderWay, kCXDStateEdition})
        _preferences.remove(kDaemonDomain, key);
    for (const std::string& key : _preferences.keys(kDaemonDomain))
        if (isStateRow(key)) _preferences.remove(kDaemonDomain, key);
    _preferences.synchronize(kDaemonDomain);
    const Lock guard(_lock);
    _conduitData.reset();
}

} // namespace rolvane
