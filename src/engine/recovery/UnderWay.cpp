#include "engine/recovery/UnderWay.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/records/CXGroup.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PublicationCache.h"
#include "engine/recovery/Holdings.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <array>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

namespace rolvane {

namespace {

constexpr const char* kPeople = "people";
constexpr const char* kGroups = "groups";
constexpr const char* kNamed = "named";
constexpr std::array kLists{kMemberAdds, kMemberRemoves, kSubgroupAdds, kSubgroupRemoves};

Dictionary knownGroups(const Dictionary& conduitData) {
    return conduitData[kConduitVaultra].dictionary()[kPriorState].dictionary()[kSelf.str()].dictionary();
}

std::string shared(const UniqueId& uid, std::string_view table) {
    return cxUIDWithTableName(uid, table).str();
}

void addEach(Array to, const Value& elements) {
    for (const Value& element : elements.array())
        if (!to.contains(element)) to.append(element);
}

// Where a change of one member or subgroup belongs; none for other changes.
const char* listOf(int32_t type) {
    switch (type) {
    case CXDAddRecordToGroup: return kMemberAdds;
    case CXDRemoveRecordFromGroup: return kMemberRemoves;
    case CXDAddGroupToGroup: return kSubgroupAdds;
    case CXDRemoveGroupFromGroup: return kSubgroupRemoves;
    default: return nullptr;
    }
}

void noteGroup(Dictionary& group, const CXDChangeRecord& record) {
    const Value content = record.inMemoryPayload();
    const Dictionary payload = content.isDictionary() ? content.dictionary() : Dictionary();
    for (const char* list : kLists)
        if (payload.contains(list)) addEach(group.arrayFor(list), payload[list]);
    if (record.type() == CXDChangeGroupName || payload.contains(kCXGroupNameProperty)) group.set(kNamed, true);
    const char* list = listOf(record.type());
    if (!list || !record.person()) return;
    const bool isGroup = list == kSubgroupAdds || list == kSubgroupRemoves;
    group.arrayFor(list).append(shared(*record.person(), isGroup ? kCXGroupTable : kCXPersonTable));
}

// Makes the records of one pass's beginning.
class Settlement {
public:
    Settlement(const CXDChangeRecords& records, Dictionary& conduitData, CXRolvane& rolvane)
        : _conduitData(conduitData), _known(knownGroups(conduitData)), _rolvane(rolvane), _holdings(rolvane) {
        for (const CXDChangeRecordPtr& record : records)
            if (record->group() && isOwnWrite(*record)) _gathered.insert(shared(*record->group(), kCXGroupTable));
        _withdrawn = removedBy(records);
    }

    void person(const UniqueId& uid) {
        if (_holdings.person(uid)) return;
        add(CXDDeleteRecord, uid, std::nullopt);
        const UniqueId everybody(kCXAllGroupUID); // whose list it may have reached, too
        if (!_withdrawn.contains(everybody)) add(CXDRemoveRecordFromGroup, uid, everybody);
        _gone.insert(uid.str());
    }

    void group(const UniqueId& uid, const Dictionary& touched) {
        if (_withdrawn.contains(uid)) return; // and a change beside that would be folded with it into one that is none
        const bool isAll = uid.str() == kCXAllGroupUID;
        const CXGroupRef there =
            isAll ? _rolvane.allGroup() : std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(uid));
        if (!_holdings.group(uid)) {
            add(CXDDeleteGroup, std::nullopt, uid);
            _gone.insert(uid.str());
            return;
        }
        if (!there) return; // a copy of somebody else's
        const bool isKnown = _known.contains(uid.str());
        if (!isKnown && !_gathered.contains(uid.str())) return;
        const Dictionary known = _known[uid.str()].dictionary();
        std::unordered_set<std::string>& decided = _decided[uid.str()];
        for (const char* list : kLists)
            for (const Value& name : touched[list].array()) decided.insert(name.string());
        set(uid, touched, known[kMemberUIDState], there->memberUniqueIds(),
            {kMemberAdds, kMemberRemoves, CXDAddRecordToGroup, CXDRemoveRecordFromGroup, kCXPersonTable});
        set(uid, touched, known[kSubgroupUIDState], there->subgroupUniqueIds(),
            {kSubgroupAdds, kSubgroupRemoves, CXDAddGroupToGroup, CXDRemoveGroupFromGroup, kCXGroupTable});
        if (!touched[kNamed].boolean()) return;
        _renamed.insert(uid.str());
        if (isKnown && !isAll) add(CXDChangeGroupName, std::nullopt, uid, Value(there->name()));
    }

    CXDChangeRecords take() { return std::move(_records); }

    // Would it bring back, or take away, from the store what the database decides?
    bool isOverruled(const CXDChangeRecord& record) const {
        if (record.initialSource() != CXDSyncSourceVaultra || !record.changeMadeByDataOwner()) return false;
        const bool isSubgroup = record.type() == CXDAddGroupToGroup || record.type() == CXDRemoveGroupFromGroup;
        const std::string person =
            record.person() ? shared(*record.person(), isSubgroup ? kCXGroupTable : kCXPersonTable) : std::string();
        if (_gone.contains(person)) return true;
        if (!record.group()) return false;
        const std::string group = shared(*record.group(), kCXGroupTable);
        if (_gone.contains(group)) return true;
        if (record.type() == CXDChangeGroupName) return _renamed.contains(group);
        const auto decided = _decided.find(group);
        return decided != _decided.end() && decided->second.contains(person);
    }

private:
    struct Kind {
        const char *adds, *removes;
        CXDChangeType add, remove;
        std::string_view table;
    };
    // What is known and not there, or there and not known, is a matter of the scan, which brings the contents along.
    void set(const UniqueId& group, const Dictionary& touched, const Value& known, const std::vector<UniqueId>& now,
             const Kind& kind) {
        if (!touched.contains(kind.adds) && !touched.contains(kind.removes)) return;
        std::unordered_set<std::string> there;
        for (const UniqueId& uid : now) there.insert(shared(uid, kind.table));
        const Array members = known.array();
        for (const Value& name : touched[kind.adds].array())
            if (!there.contains(name.string()) && !members.containsString(name.string()))
                add(kind.remove, UniqueId(name.string()), group);
        for (const Value& name : touched[kind.removes].array())
            if (there.contains(name.string()) && members.containsString(name.string())) {
                const UniqueId uid(name.string());
                const CXDChangeRecord removal(CXDSyncSourceCX, kind.remove, kSelf, uid, group);
                didApplyChange(_conduitData, removal, CXDSyncSourceVaultra); // that may have come to its end
                add(kind.add, uid, group);
            }
    }

    void add(CXDChangeType type, const std::optional<UniqueId>& person, const std::optional<UniqueId>& group,
             const Value& payload = {}) {
        auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, kSelf, person, group, payload);
        record->setAppliesToSources(CXDSyncSourceVaultra);
        _records.push_back(std::move(record));
    }

    Dictionary& _conduitData;
    const Dictionary _known; // by group
    CXRolvane& _rolvane;
    Holdings _holdings;
    std::unordered_set<std::string> _gathered, _gone, _renamed;
    std::unordered_set<UniqueId> _withdrawn;
    std::unordered_map<std::string, std::unordered_set<std::string>> _decided; // by group, its members and subgroups
    CXDChangeRecords _records;
};

// Who and what is not in both lists of all that are known.
void addUnlisted(Dictionary& left, const Dictionary& underWay, const Dictionary& conduitData,
                 const std::unordered_set<UniqueId>& removed) {
    const Dictionary touchedGroups = underWay[kGroups].dictionary();
    if (removed.contains(UniqueId(kCXAllGroupUID))) return;
    std::array<Dictionary, 2> lists;
    bool listed = true;
    for (size_t i = 0; const char* conduit : {kConduitCX, kConduitVaultra}) {
        const Dictionary groups = conduitData[conduit].dictionary()[kPriorState].dictionary()[kSelf.str()].dictionary();
        listed = listed && groups.contains(kCXAllGroupUID);
        lists[i++] = groups[kCXAllGroupUID].dictionary();
    }
    if (!listed && !touchedGroups.contains(kCXAllGroupUID)) return;
    const auto isAdrift = [&](const std::string& name, const char* list) {
        return !removed.contains(UniqueId(name)) && std::any_of(lists.begin(), lists.end(), [&](const Dictionary& all) {
            return !all[list].array().containsString(name);
        });
    };
    for (const Value& person : underWay[kPeople].array())
        if (isAdrift(person.string(), kMemberUIDState)) left.arrayFor(kPeople).append(person);
    for (const auto& [group, touched] : touchedGroups)
        if (group == kCXAllGroupUID ? !listed : isAdrift(group, kSubgroupUIDState))
            left.dictionaryFor(kGroups).dictionaryFor(group);
}

} // namespace

bool isOwnWrite(const CXDChangeRecord& record) {
    return record.initialSource() == CXDSyncSourceCX && record.changeMadeByDataOwner() &&
           (record.appliesToSources() & CXDSyncSourceVaultra) != 0;
}

Dictionary underWay(const CXDChangeRecords& records) {
    Dictionary all;
    for (const CXDChangeRecordPtr& record : records) {
        if (!isOwnWrite(*record)) continue;
        if (record->type() == CXDUpdateRecord && record->person()) {
            all.arrayFor(kPeople).append(shared(*record->person(), kCXPersonTable));
        } else if (record->group() && *record->group() != kPeopleGroup && record->type() != CXDDeleteGroup) {
            Dictionary groups = all.dictionaryFor(kGroups);
            Dictionary group = groups.dictionaryFor(shared(*record->group(), kCXGroupTable));
            noteGroup(group, *record);
        }
    }
    return all;
}

Dictionary underWayTogether(const Dictionary& former, const Dictionary& latter) {
    Dictionary both = Value(former).deepMutableCopy().dictionary();
    if (latter.contains(kPeople)) addEach(both.arrayFor(kPeople), latter[kPeople]);
    for (const auto& [uid, touched] : latter[kGroups].dictionary()) {
        Dictionary group = both.dictionaryFor(kGroups).dictionaryFor(uid);
        for (const char* list : kLists)
            if (touched.dictionary().contains(list)) addEach(group.arrayFor(list), touched.dictionary()[list]);
        if (touched.dictionary()[kNamed].boolean()) group.set(kNamed, true);
    }
    return both;
}

std::unordered_set<UniqueId> removedBy(const CXDChangeRecords& records) {
    std::unordered_set<UniqueId> removed;
    for (const CXDChangeRecordPtr& record : records) {
        if (!isOwnWrite(*record)) continue;
        if (record->type() == CXDDeleteRecord && record->person())
            removed.insert(cxUIDWithTableName(*record->person(), kCXPersonTable));
        if (record->type() == CXDDeleteGroup && record->group())
            removed.insert(cxUIDWithTableName(*record->group(), kCXGroupTable));
    }
    return removed;
}

CXDChangeRecords ownWrites(const CXDChangeRecords& records) {
    CXDChangeRecords own;
    for (const CXDChangeRecordPtr& record : records)
        if (isOwnWrite(*record)) own.push_back(record);
    return own;
}

std::unordered_set<UniqueId> groupsOf(const CXDChangeRecords& ownWrites) {
    std::unordered_set<UniqueId> groups;
    for (const CXDChangeRecordPtr& record : ownWrites)
        if (record->group()) groups.insert(cxUIDWithTableName(*record->group(), kCXGroupTable));
    return groups;
}

Dictionary adrift(const Dictionary& underWay, const Dictionary& conduitData, const PassEnd& end) {
    Dictionary left;
    for (const auto& [group, touched] : underWay[kGroups].dictionary())
        if (end.unsureGroups.contains(UniqueId(group)) && !end.removed.contains(UniqueId(group)))
            left.dictionaryFor(kGroups).set(group, touched);
    if (end.everythingIsPublished) addUnlisted(left, underWay, conduitData, end.removed);
    return left;
}

void settleUnderWay(const Dictionary& underWay, CXDChangeRecords& records, Dictionary& conduitData,
                    CXRolvane& rolvane) {
    Settlement settlement(records, conduitData, rolvane);
    for (const Value& person : underWay[kPeople].array()) settlement.person(UniqueId(person.string()));
    for (const auto& [group, touched] : underWay[kGroups].dictionary())
        settlement.group(UniqueId(group), touched.dictionary());
    std::erase_if(records, [&](const CXDChangeRecordPtr& record) { return settlement.isOverruled(*record); });
    for (CXDChangeRecordPtr& record : settlement.take()) records.push_back(std::move(record));
}

} // namespace rolvane
