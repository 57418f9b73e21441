#include "engine/recovery/UnderWay.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/records/CXGroup.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PriorStates.h"
#include "engine/recovery/Holdings.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <array>
#include <set>
#include <string_view>
#include <unordered_map>
#include <unordered_set>

namespace rolvane {

namespace {

constexpr const char* kPeople = "people";
constexpr const char* kGroups = "groups";
constexpr const char* kNames = "names";
constexpr std::array kLists{kMemberAdds, kMemberRemoves, kSubgroupAdds, kSubgroupRemoves};

Dictionary knownGroups(const Dictionary& conduitData, const UserName& user) {
    return conduitData[kConduitVaultra].dictionary()[kPriorState].dictionary()[user.str()].dictionary();
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

std::string_view tableOf(const char* list) {
    return list == kSubgroupAdds || list == kSubgroupRemoves ? kCXGroupTable : kCXPersonTable;
}

void noteGroup(Dictionary& group, const CXDChangeRecord& record) {
    const Value content = record.inMemoryPayload();
    const Dictionary payload = content.isDictionary() ? content.dictionary() : Dictionary();
    for (const char* list : kLists)
        if (payload.contains(list)) addEach(group.arrayFor(list), payload[list]);
    const Value& name = record.type() == CXDChangeGroupName ? content : payload[kCXGroupNameProperty];
    if (name.isString()) addEach(group.arrayFor(kNames), Array{name});
    const char* list = listOf(record.type());
    if (!list || !record.person()) return;
    group.arrayFor(list).append(shared(*record.person(), tableOf(list)));
}

bool isWrite(const CXDChangeRecord& record) {
    return record.initialSource() == CXDSyncSourceCX && record.user() &&
           (record.appliesToSources() & CXDSyncSourceVaultra) != 0;
}

// Makes the records of one pass's beginning, for one tree.
class Settlement {
public:
    Settlement(const CXDChangeRecords& records, size_t fresh, const SharedTree& tree, Dictionary& conduitData,
               CXRolvane& rolvane)
        : _tree(tree), _conduitData(conduitData), _known(knownGroups(conduitData, tree.user)), _rolvane(rolvane),
          _holdings(rolvane, records, fresh) {
        for (const CXDChangeRecordPtr& record : records) {
            if (record->user() != _tree.user) continue;
            if (record->group() && isWrite(*record)) _gathered.insert(shared(*record->group(), kCXGroupTable));
            if (record->group() && record->initialSource() == CXDSyncSourceVaultra &&
                record->type() == CXDChangeGroupName)
                _namesThere[shared(*record->group(), kCXGroupTable)] = record->inMemoryPayload();
            if (const auto step = stepOf(*record); step && record->initialSource() == CXDSyncSourceVaultra)
                _news[shared(*record->group(), kCXGroupTable)].insert(*step);
            if (record->type() == CXDDeleteGroup && record->group() && isWrite(*record))
                _withdrawn.insert(cxUIDWithTableName(*record->group(), kCXGroupTable));
        }
    }

    void person(const UniqueId& uid) {
        if (_holdings.person(uid)) return;
        add(CXDDeleteRecord, uid, std::nullopt);
        const UniqueId everybody(kCXAllGroupUID); // whose list it may have reached, too
        if (!_withdrawn.contains(everybody)) add(CXDRemoveRecordFromGroup, uid, everybody);
        _gone.insert(uid.str());
    }

    // Gives the part that has to wait until the tree is read.
    Dictionary group(const UniqueId& uid, const Dictionary& touched) {
        Dictionary left;
        if (_withdrawn.contains(uid)) return left; // and a change beside that would be folded into one that is none
        const bool isAll = uid.str() == kCXAllGroupUID;
        if (!_holdings.group(uid)) {
            add(CXDDeleteGroup, std::nullopt, uid);
            _gone.insert(uid.str());
            return left;
        }
        const CXGroupRef there =
            isAll ? _tree.everybody : std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(inDatabase(uid)));
        if (!there) return left; // of another tree
        const bool isKnown = _known.contains(uid.str());
        if (!isKnown && !_gathered.contains(uid.str())) return left;
        const Dictionary known = _known[uid.str()].dictionary();
        set(uid, touched, known[kMemberUIDState], there->memberUniqueIds(),
            {kMemberAdds, kMemberRemoves, CXDAddRecordToGroup, CXDRemoveRecordFromGroup, kCXPersonTable});
        set(uid, touched, known[kSubgroupUIDState], there->subgroupUniqueIds(),
            {kSubgroupAdds, kSubgroupRemoves, CXDAddGroupToGroup, CXDRemoveGroupFromGroup, kCXGroupTable});
        if (isAll || !touched.contains(kNames)) return left;
        if (!_tree.isRead) {
            left.set(kNames, touched[kNames]);
            return left;
        }
        const auto name = _namesThere.find(uid.str());
        const Value here(there->name());
        if (name == _namesThere.end() || name->second == here) return left;
        const Array written = touched[kNames].array();
        // A name that the pass did not write comes from somebody else, who has seen the one that it wrote.
        if (!written.contains(name->second)) {
            if (written.contains(here)) _renamedThere.set(uid.str(), name->second);
            return left;
        }
        _renamed.insert(uid.str());
        add(CXDChangeGroupName, std::nullopt, uid, here);
        return left;
    }

    CXDChangeRecords take() { return std::move(_records); }

    // The same of a record that says more than the name. A group that is made has to have one.
    void overruleNameIn(CXDChangeRecordPtr& record) const {
        if (record->user() != _tree.user || !record->group()) return;
        const bool makes = record->type() == CXDCreateStructureForGroup;
        const bool isOurs = (makes || record->type() == CXDCompositeGroupChange) && isWrite(*record);
        const bool isTheirs = makes && record->initialSource() == CXDSyncSourceVaultra;
        const std::string group = shared(*record->group(), kCXGroupTable);
        if (!(isOurs && _renamedThere.contains(group)) && !(isTheirs && _renamed.contains(group))) return;
        const Value content = record->inMemoryPayload();
        if (!content.isDictionary() || !content.dictionary().contains(kCXGroupNameProperty)) return;
        Dictionary other = content.dictionary().mutableCopy();
        if (isOurs && makes)
            other.set(kCXGroupNameProperty, _renamedThere[group]);
        else
            other.remove(kCXGroupNameProperty);
        record = std::make_shared<CXDChangeRecord>(*record);
        record->setPayload(other);
    }

    // Would it bring back, or take away, from the store what the database decides? Or name a group once more that
    // somebody else has given another name since?
    bool isOverruled(const CXDChangeRecord& record) const {
        if (record.user() != _tree.user) return false;
        if (isWrite(record) && record.type() == CXDChangeGroupName && record.group())
            return _renamedThere.contains(shared(*record.group(), kCXGroupTable));
        const auto step = stepOf(record);
        if (isWrite(record) && step) return has(_arrived, shared(*record.group(), kCXGroupTable), *step);
        if (record.initialSource() != CXDSyncSourceVaultra) return false;
        const std::string person = step              ? step->second
                                   : record.person() ? shared(*record.person(), kCXPersonTable)
                                                     : std::string();
        if (_gone.contains(person)) return true;
        if (!record.group()) return false;
        const std::string group = shared(*record.group(), kCXGroupTable);
        if (_gone.contains(group)) return true;
        if (record.type() == CXDChangeGroupName) return _renamed.contains(group);
        return has(_decided, group, {record.type(), person});
    }
    bool hasArrived() const { return !_arrived.empty(); }
    const Dictionary& namesOfOthers() const { return _renamedThere; }

private:
    struct Kind {
        const char *adds, *removes;
        CXDChangeType add, remove;
        std::string_view table;
    };
    using Step = std::pair<int32_t, std::string>;                  // a change of one member or subgroup
    using Steps = std::unordered_map<std::string, std::set<Step>>; // by group
    static bool has(const Steps& steps, const std::string& group, const Step& step) {
        const auto of = steps.find(group);
        return of != steps.end() && of->second.contains(step);
    }
    static std::optional<Step> stepOf(const CXDChangeRecord& record) {
        const char* list = listOf(record.type());
        if (!list || !record.person() || !record.group()) return std::nullopt;
        return Step{record.type(), shared(*record.person(), tableOf(list))};
    }
    UniqueId inDatabase(const UniqueId& group) const {
        return _tree.user == kSelf ? group : cxUIDWithTableName(group, kCXSubscribedGroupTable);
    }
    // What is known and not there, or there and not known, is a matter of the scan, which brings the contents along.
    void set(const UniqueId& group, const Dictionary& touched, const Value& known, const std::vector<UniqueId>& now,
             const Kind& kind) {
        if (!touched.contains(kind.adds) && !touched.contains(kind.removes)) return;
        std::unordered_set<std::string> there;
        for (const UniqueId& uid : now) there.insert(shared(uid, kind.table));
        const Array members = known.array();
        auto& decided = _decided[group.str()];
        for (const Value& name : touched[kind.adds].array()) {
            decided.emplace(kind.add, name.string());
            if (members.containsString(name.string())) continue;
            if (!there.contains(name.string()))
                add(kind.remove, UniqueId(name.string()), group);
            else
                noteArrival(group, {kind.add, name.string()});
        }
        for (const Value& name : touched[kind.removes].array()) {
            decided.emplace(kind.remove, name.string());
            if (!members.containsString(name.string())) continue;
            if (!there.contains(name.string())) {
                noteArrival(group, {kind.remove, name.string()});
                continue;
            }
            const UniqueId uid(name.string());
            const CXDChangeRecord removal(CXDSyncSourceCX, kind.remove, _tree.user, uid, group);
            didApplyChange(_conduitData, removal, CXDSyncSourceVaultra); // that may have come to its end
            add(kind.add, uid, group);
        }
    }

    // The store has the change as well as the database: it was written. A list of everybody says nothing of that, and
    // nothing is said of somebody whom it does not know, because their own files may still have to be written.
    void noteArrival(const UniqueId& group, const Step& step) {
        if (group.str() == kCXAllGroupUID || !_known.contains(group.str()) || !has(_news, group.str(), step)) return;
        const auto& [type, uid] = step;
        const bool isSubgroup = tableOf(listOf(type)) == kCXGroupTable;
        const Dictionary everybody = _known[kCXAllGroupUID].dictionary();
        if (!everybody[isSubgroup ? kSubgroupUIDState : kMemberUIDState].array().containsString(uid)) return;
        const CXDChangeRecord change(CXDSyncSourceCX, type, _tree.user, UniqueId(uid), group);
        didApplyChange(_conduitData, change, CXDSyncSourceVaultra);
        _arrived[group.str()].insert(step);
    }

    void add(CXDChangeType type, const std::optional<UniqueId>& person, const std::optional<UniqueId>& group,
             const Value& payload = {}) {
        auto record = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, _tree.user, person, group, payload);
        record->setAppliesToSources(CXDSyncSourceVaultra);
        _records.push_back(std::move(record));
    }

    const SharedTree& _tree;
    Dictionary& _conduitData;
    const Dictionary _known; // by group
    CXRolvane& _rolvane;
    Holdings _holdings;
    std::unordered_set<std::string> _gathered, _gone, _renamed;
    Dictionary _renamedThere; // by group: the name that somebody else gave it
    std::unordered_set<UniqueId> _withdrawn;
    std::unordered_map<std::string, Value> _namesThere; // that the store has and that are not known, by group
    Steps _decided;                                     // that the pass was to make
    Steps _news;                                        // in which the store differs from what is known
    Steps _arrived;                                     // of both
    CXDChangeRecords _records;
};

// Who and what is not in both lists of all that are known.
void addUnlisted(Dictionary& left, const Dictionary& own, const Dictionary& conduitData,
                 const std::unordered_set<UniqueId>& removed) {
    const Dictionary touchedGroups = own[kGroups].dictionary();
    if (removed.contains(UniqueId(kCXAllGroupUID))) return;
    std::array<Dictionary, 2> lists;
    bool listed = true;
    for (size_t i = 0; const char* conduit : {kConduitCX, kConduitVaultra}) {
        const Dictionary groups = conduitData[conduit].dictionary()[kPriorState].dictionary()[kSelf.str()].dictionary();
        listed = listed && groups.contains(kCXAllGroupUID);
        lists[i++] = groups[kCXAllGroupUID].dictionary();
    }
    if (!listed && !touchedGroups.contains(kCXAllGroupUID)) return;
    const auto isUnsettled = [&](const std::string& name, const char* list) {
        return !removed.contains(UniqueId(name)) && std::any_of(lists.begin(), lists.end(), [&](const Dictionary& all) {
            return !all[list].array().containsString(name);
        });
    };
    for (const Value& person : own[kPeople].array())
        if (isUnsettled(person.string(), kMemberUIDState)) left.arrayFor(kPeople).append(person);
    for (const auto& [group, touched] : touchedGroups)
        if (group == kCXAllGroupUID ? !listed : isUnsettled(group, kSubgroupUIDState))
            left.dictionaryFor(kGroups).set(group, touched);
}

} // namespace

bool isOwnWrite(const CXDChangeRecord& record) {
    return record.initialSource() == CXDSyncSourceCX && record.changeMadeByDataOwner() &&
           (record.appliesToSources() & CXDSyncSourceVaultra) != 0;
}

Dictionary underWay(const CXDChangeRecords& records) {
    Dictionary all;
    for (const CXDChangeRecordPtr& record : records) {
        if (!isWrite(*record)) continue;
        if (record->type() == CXDUpdateRecord && record->person()) {
            all.dictionaryFor(record->user()->str())
                .arrayFor(kPeople)
                .append(shared(*record->person(), kCXPersonTable));
        } else if (record->group() && *record->group() != kPeopleGroup && record->type() != CXDDeleteGroup) {
            Dictionary groups = all.dictionaryFor(record->user()->str()).dictionaryFor(kGroups);
            Dictionary group = groups.dictionaryFor(shared(*record->group(), kCXGroupTable));
            noteGroup(group, *record);
        }
    }
    return all;
}

Dictionary underWayInAnyForm(const Dictionary& stored) {
    const Dictionary groups = stored[kGroups].dictionary();
    const bool isOfOneUser = stored[kPeople].isArray() ||
                             std::any_of(groups.begin(), groups.end(),
                                         [](const auto& group) { return group.first.ends_with(kCXGroupTable); });
    return isOfOneUser ? Dictionary{{kSelf.str(), stored}} : stored;
}

Dictionary underWayTogether(const Dictionary& former, const Dictionary& latter) {
    Dictionary both = Value(former).deepMutableCopy().dictionary();
    for (const auto& [user, of] : latter) {
        Dictionary tree = both.dictionaryFor(user);
        const Dictionary& added = of.dictionary();
        if (added.contains(kSubscription)) tree.set(kSubscription, added[kSubscription]);
        if (added.contains(kPeople)) addEach(tree.arrayFor(kPeople), added[kPeople]);
        for (const auto& [uid, touched] : added[kGroups].dictionary()) {
            Dictionary group = tree.dictionaryFor(kGroups).dictionaryFor(uid);
            for (const auto& [list, elements] : touched.dictionary()) addEach(group.arrayFor(list), elements);
        }
    }
    return both;
}

Dictionary withoutNames(const Dictionary& underWay, const Dictionary& namesOfOthers) {
    if (namesOfOthers.empty()) return underWay;
    const Dictionary without = Value(underWay).deepMutableCopy().dictionary();
    for (const auto& [user, of] : without)
        for (const auto& [group, touched] : of.dictionary()[kGroups].dictionary())
            if (touched.dictionary().contains(kNames) && namesOfOthers.contains(group))
                touched.dictionary()[kNames].array().removeAll(namesOfOthers[group]);
    return without;
}

Dictionary withNamesBefore(const Dictionary& underWay, const Dictionary& former) {
    Dictionary both = Value(underWay).deepMutableCopy().dictionary();
    for (const auto& [user, of] : both)
        for (const auto& [group, touched] : of.dictionary()[kGroups].dictionary())
            if (touched.dictionary().contains(kNames))
                addEach(touched.dictionary()[kNames].array(),
                        former[user].dictionary()[kGroups].dictionary()[group].dictionary()[kNames]);
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

Dictionary unsettledAfter(const Dictionary& underWay, const Dictionary& conduitData, const PassEnd& end) {
    const Dictionary own = underWay[kSelf.str()].dictionary();
    Dictionary left;
    for (const auto& [group, touched] : own[kGroups].dictionary())
        if (end.unsettledGroups.contains(UniqueId(group)) && !end.removed.contains(UniqueId(group)))
            left.dictionaryFor(kGroups).set(group, touched);
    if (end.everythingIsPublished) addUnlisted(left, own, conduitData, end.removed);
    return left.empty() ? end.unread : underWayTogether(end.unread, Dictionary{{kSelf.str(), left}});
}

SettledUnderWay settleUnderWay(const Dictionary& underWay, const SharedTree& tree, CXDChangeRecords& records,
                               size_t fresh, Dictionary& conduitData, CXRolvane& rolvane) {
    Settlement settlement(records, fresh, tree, conduitData, rolvane);
    const Dictionary of = underWay[tree.user.str()].dictionary();
    Dictionary left;
    for (const Value& person : of[kPeople].array()) settlement.person(UniqueId(person.string()));
    for (const auto& [group, touched] : of[kGroups].dictionary())
        if (const Dictionary rest = settlement.group(UniqueId(group), touched.dictionary()); !rest.empty())
            left.dictionaryFor(tree.user.str()).dictionaryFor(kGroups).set(group, rest);
    if (!left.empty() && of.contains(kSubscription))
        left.dictionaryFor(tree.user.str()).set(kSubscription, of[kSubscription]);
    std::erase_if(records, [&](const CXDChangeRecordPtr& record) { return settlement.isOverruled(*record); });
    for (CXDChangeRecordPtr& record : records) settlement.overruleNameIn(record);
    for (CXDChangeRecordPtr& record : settlement.take()) records.push_back(std::move(record));
    return {left, settlement.hasArrived(), settlement.namesOfOthers()};
}

} // namespace rolvane
