#include "conduits/store/StoreComparison.h"

#include "conduits/PublishedLayout.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "model/PayloadKeys.h"

#include <string_view>
#include <unordered_set>

namespace rolvane {
namespace {

constexpr std::string_view kGroupSuffix = "CXGroup";

using Names = std::unordered_set<std::string_view>; // of strings that the array keeps alive

Names namesIn(const Array& array) {
    Names names;
    names.reserve(array.count());
    for (const Value& element : array)
        if (const std::string* text = element.stringIf()) names.insert(*text);
    return names;
}

// What is shared is never named as somebody's copy of it. Taken at its word, such a name would make a copy that hides
// the record itself.
bool isShared(std::string_view name) {
    return !name.ends_with(kCXSubscribedPersonTable) && !name.ends_with(kCXSubscribedGroupTable);
}

// The shared names of `array`, in order, that are not among the names.
Array without(const Array& array, const Names& names) {
    Array rest;
    for (const Value& element : array)
        if (const std::string* text = element.stringIf();
            text && !text->empty() && isShared(*text) && !names.contains(*text))
            rest.append(element);
    return rest;
}

bool isDifferent(const Value& name, const Value& prior) {
    return !prior.isString() || prior.string() != name.string();
}

// Collects the records of one user.
class UserComparison {
public:
    UserComparison(const Dictionary& prior, const Dictionary& current, const StoreUser& user)
        : _prior(prior), _current(current), _user(user), _isOwner(user.user == kSelf) {}

    CXDChangeRecords records() {
        contacts();
        for (const auto& [key, state] : _prior)
            if (key.ends_with(kGroupSuffix)) group(key);
        for (const auto& [key, state] : _current)
            if (key.ends_with(kGroupSuffix) && !_prior.contains(key)) group(key);
        return std::move(_records);
    }

private:
    void contacts() {
        const Dictionary people = _current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
        for (const auto& [contact, info] : people)
            if (_user.isNew || isRecent(info.dictionary()[kModificationDate].date())) update(UniqueId(contact));
    }

    bool isRecent(const std::optional<Date>& modified) const {
        return modified && _user.lastSyncDate && modified->secondsSince(*_user.lastSyncDate) > kSyncMargin;
    }

    void group(const std::string& key) {
        UniqueId group(key);
        if (!_prior.contains(key)) group = announce(group);
        const Dictionary difference = groupDifference(_prior[key], _current[key]);
        for (const Value& added : difference[kMemberAdds].array())
            add(CXDAddRecordToGroup, update(UniqueId(added.string())), group);
        for (const Value& removed : difference[kMemberRemoves].array())
            add(CXDRemoveRecordFromGroup, UniqueId(removed.string()), group);
        for (const Value& added : difference[kSubgroupAdds].array())
            add(CXDAddGroupToGroup, UniqueId(added.string()), group);
        for (const Value& removed : difference[kSubgroupRemoves].array())
            add(CXDRemoveGroupFromGroup, UniqueId(removed.string()), group);
        if (cxUIDWithTableName(group, kCXGroupTable).str() == layout::kAllGroup) return; // every database names its own
        for (const auto& [person, choices] : difference[kDistributionListUpdates].dictionary())
            add(CXDUpdateDistributionList, UniqueId(person), group, choices);
        for (const Value& name : difference[kNameChanges].array()) add(CXDChangeGroupName, {}, group, name);
    }

    // A group that was not known. Gives the identifier under which the rest of its records name it.
    UniqueId announce(const UniqueId& key) {
        Dictionary payload;
        UniqueId group = key;
        if (!_isOwner) {
            group = cxUIDWithTableName(key, kCXSubscribedGroupTable);
            CXMutableMultiValue location;
            location.addValue(_user.base, kCXSubscribeLabel);
            payload.set(kCXRemoteLocationProperty, location.toValue());
        }
        if (mayWrite()) payload.set(kCXReadWriteSharingACLProperty, _user.user);
        const Value name = _current[key.str()].dictionary()[kCXGroupNameProperty];
        if (name.isString()) payload.set(kCXGroupNameProperty, name);
        add(CXDCreateStructureForGroup, {}, group, payload);
        return group;
    }

    bool mayWrite() {
        if (!_mayWrite) _mayWrite = _user.mayWrite && _user.mayWrite();
        return *_mayWrite;
    }

    std::optional<UniqueId> update(const UniqueId& contact) {
        _records.push_back(_user.contactUpdate(contact));
        return _records.back()->person();
    }

    void add(CXDChangeType type, const std::optional<UniqueId>& person, const UniqueId& group,
             const Value& payload = {}) {
        auto record = std::make_shared<CXDChangeRecord>(_user.source, type, _user.user, person, group, payload);
        record->setAppliesToSources(CXDSyncSourceCX);
        _records.push_back(std::move(record));
    }

    const Dictionary& _prior;
    const Dictionary& _current;
    const StoreUser& _user;
    const bool _isOwner;
    std::optional<bool> _mayWrite;
    CXDChangeRecords _records;
};

void addDifference(Dictionary& result, const char* addsKey, const char* removesKey, const Array& prior,
                   const Array& current) {
    result.set(addsKey, without(current, namesIn(prior)));
    result.set(removesKey, without(prior, namesIn(current)));
}

} // namespace

CXDChangeRecords compareStoreStates(const Dictionary& prior, const Dictionary& current, const StoreUser& user) {
    return UserComparison(prior, current, user).records();
}

Dictionary groupDifference(const Value& prior, const Value& current) {
    const Dictionary before = prior.dictionary(), now = current.dictionary();
    Dictionary result;
    addDifference(result, kMemberAdds, kMemberRemoves, before[kMemberUIDState].array(), now[kMemberUIDState].array());
    addDifference(result, kSubgroupAdds, kSubgroupRemoves, before[kSubgroupUIDState].array(),
                  now[kSubgroupUIDState].array());
    Array names;
    const Value& name = now[kCXGroupNameProperty];
    if (name.isString() && isDifferent(name, before[kCXGroupNameProperty])) names.append(name);
    result.set(kNameChanges, names);
    result.addEntriesFrom(distributionListDifference(before[kDistributionListState], now[kDistributionListState]));
    return result;
}

Dictionary distributionListDifference(const Value& prior, const Value& current) {
    const Dictionary before = prior.dictionary(), now = current.dictionary();
    Dictionary updates;
    for (const auto& [person, choices] : now)
        if (before[person] != choices) updates.set(person, choices);
    Array removes;
    for (const auto& [person, choices] : before)
        if (!now.contains(person)) removes.append(person);
    return {{kDistributionListUpdates, updates}, {kDistributionListRemoves, removes}};
}

} // namespace rolvane
