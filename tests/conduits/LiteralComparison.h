#pragma once

#include "conduits/store/StoreComparison.h"
#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"

namespace rolvane::test {

// The comparison of two states of one user as it reads step by step, element by element: the oracle of the fast one.
inline Array literalLacking(const Array& from, const Array& other) {
    Array rest;
    for (const Value& each : from) {
        bool found = false;
        for (const Value& candidate : other) found = found || candidate == each;
        if (!found) rest.append(each);
    }
    return rest;
}

inline CXDChangeRecords literalComparison(const Dictionary& pri, const Dictionary& cur, const StoreUser& who) {
    CXDChangeRecords out;
    const bool owner = who.user == kSelf;
    const auto emit = [&](int type, std::optional<UniqueId> person, std::optional<UniqueId> group, Value payload = {}) {
        out.push_back(std::make_shared<CXDChangeRecord>(who.source, type, who.user, person, group, payload));
        out.back()->setAppliesToSources(1);
    };
    const Dictionary people = cur["People"].dictionary()["memberUIDState"].dictionary();
    for (const std::string& uid : people.allKeys()) {
        if (!who.isNew) {
            const auto date = people[uid].dictionary()["modificationdate"].date();
            if (!date || !who.lastSyncDate || date->secondsSince(*who.lastSyncDate) <= 4.0) continue;
        }
        out.push_back(who.contactUpdate(UniqueId(uid)));
    }
    Array priKeys, curKeys;
    for (const std::string& key : pri.allKeys()) priKeys.append(key);
    for (const std::string& key : cur.allKeys()) curKeys.append(key);
    for (const Value& element : cxArrayCombinedWithArray(priKeys, curKeys)) {
        const std::string key = element.string();
        if (!key.ends_with("CXGroup")) continue;
        UniqueId group(key);
        Dictionary priGroup = pri[key].dictionary();
        const Dictionary curGroup = cur[key].dictionary();
        if (!pri.contains(key)) {
            Dictionary payload;
            if (!owner) {
                group = cxUIDWithTableName(group, "CXSubscribedGroup");
                CXMutableMultiValue location;
                location.addValue(who.base, kCXSubscribeLabel);
                payload.set(kCXRemoteLocationProperty, location.toValue());
            }
            if (who.mayWrite()) payload.set(kCXReadWriteSharingACLProperty, who.user);
            if (curGroup.contains(kCXGroupNameProperty))
                payload.set(kCXGroupNameProperty, curGroup[kCXGroupNameProperty]);
            emit(CXDCreateStructureForGroup, {}, group, payload);
        }
        const Array priMembers = priGroup["memberUIDState"].array(), curMembers = curGroup["memberUIDState"].array();
        for (const Value& uid : literalLacking(curMembers, priMembers)) {
            out.push_back(who.contactUpdate(UniqueId(uid.string())));
            emit(CXDAddRecordToGroup, out.back()->person(), group);
        }
        for (const Value& uid : literalLacking(priMembers, curMembers))
            emit(CXDRemoveRecordFromGroup, UniqueId(uid.string()), group);
        const Array priSubgroups = priGroup["subgroupUIDState"].array();
        const Array curSubgroups = curGroup["subgroupUIDState"].array();
        for (const Value& uid : literalLacking(curSubgroups, priSubgroups))
            emit(CXDAddGroupToGroup, UniqueId(uid.string()), group);
        for (const Value& uid : literalLacking(priSubgroups, curSubgroups))
            emit(CXDRemoveGroupFromGroup, UniqueId(uid.string()), group);
        if (cxUIDWithTableName(group, "CXGroup").str() == "AllCXGroup") continue;
        const Dictionary priLists = priGroup["distributionListState"].dictionary();
        const Dictionary curLists = curGroup["distributionListState"].dictionary();
        for (const std::string& person : curLists.allKeys())
            if (!(curLists[person] == priLists[person]))
                emit(CXDUpdateDistributionList, UniqueId(person), group, curLists[person]);
        const Value name = curGroup[kCXGroupNameProperty];
        if (name && (!priGroup.contains(kCXGroupNameProperty) || priGroup[kCXGroupNameProperty] != name))
            emit(CXDChangeGroupName, {}, group, name);
    }
    return out;
}

} // namespace rolvane::test
