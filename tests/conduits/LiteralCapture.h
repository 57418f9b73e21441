#pragma once

#include "CaptureWorld.h"

#include <set>

namespace rolvane::test {

// Change capture record by record, the way its rules are put: objects, one query each, nothing kept. Slow, and what the
// conduit has to agree with.
class LiteralCapture {
public:
    LiteralCapture(FakeEngine& engine, CXRolvane& database) : _engine(engine), _database(database) {}

    CXDChangeRecords changeRecords(Date lastSync) {
        CXDChangeRecords all;
        const auto each = [&](const CXSearchElement& element, auto&& call) {
            for (const auto& record : _database.recordsMatchingSearchElement(element)) append(all, call(record));
        };
        const auto groups = [this](const CXRecordRef& record) {
            return changesForGroup(std::dynamic_pointer_cast<CXGroup>(record));
        };
        const auto people = [this](const CXRecordRef& record) {
            return changesForPerson(std::dynamic_pointer_cast<CXPerson>(record), true);
        };
        each(CXGroup::searchElementForProperty(kCXModificationDateProperty, "", "", lastSync, 4), groups);
        each(CXSubscribedGroup::searchElementForProperty(kCXModificationDateProperty, "", "", lastSync, 4), groups);
        each(CXPerson::searchElementForProperty(kCXModificationDateProperty, "", "", lastSync, 4), people);
        each(CXSubscribedPerson::searchElementForProperty(kCXModificationDateProperty, "", "", lastSync, 4), people);
        for (const auto& subscription : _database.subscriptions())
            if (subscription->_isAll() && !isNews(subscription->remoteLocation()))
                append(all, changesForGroup(_database.allGroupForRemoteLocation(subscription->remoteLocation())));
        append(all, changesForGroup(_database.allGroup()));
        return all;
    }

    // A subscription by which nothing has come yet.
    bool isNews(const RemoteLocation& location) {
        const auto group = _database.allGroupForRemoteLocation(location);
        const auto known = _engine.conduitObjectForKey("CXDCX", "priorState");
        return group->members().empty() && group->subgroups().empty() &&
               !known[_engine.userForRemoteLocation(location).str()].dictionary().contains("AllCXGroup");
    }

    CXDChangeRecords changesForPerson(const CXPersonRef& person, bool update) {
        CXDChangeRecords all;
        if (!person) return all;
        std::vector<CXGroupRef> groups = person->parentGroups();
        groups.push_back(person->isSubscribed() ? _database.allGroupForRemoteLocation(person->remoteLocation())
                                                : _database.allGroup());
        std::vector<std::string> locations;
        for (const auto& group : groups) {
            const auto values = group ? group->multiValueForProperty(kCXRemoteLocationProperty) : std::nullopt;
            if (!values) continue;
            for (const auto& identifier : values->identifiers()) {
                const auto label = values->labelForIdentifier(identifier);
                if (label != kCXPublishLabel && label != kCXSubscribeLabel) continue;
                const std::string location = values->valueForIdentifier(identifier).string();
                if (std::find(locations.begin(), locations.end(), location) == locations.end())
                    locations.push_back(location);
            }
        }
        const UniqueId uid = cxUIDWithTableName(person->sharingUniqueId(), "CXPerson");
        for (const auto& location : locations) {
            const UserName user = _engine.userForRemoteLocation(RemoteLocation(location));
            const int32_t sources = syncSourceForRemoteLocation(RemoteLocation(location));
            add(all, CXDUpdateRecord, user, uid, {}, person->dictionaryRepresentation(), sources);
            for (const auto& group : person->parentGroups()) {
                Dictionary choices;
                for (const auto& property : person->cxUsedProperties())
                    if (const auto chosen = group->distributionIdentifierForProperty(property, person))
                        choices.set(property, *chosen);
                add(all, CXDUpdateDistributionList, user, uid, cxUIDWithTableName(group->sharingUniqueId(), "CXGroup"),
                    choices, sources);
            }
            if (!update) add(all, CXDAddRecordToGroup, user, uid, UniqueId("AllCXGroup"), {}, sources);
        }
        return all;
    }

    CXDChangeRecords changesForGroup(const CXGroupRef& group) {
        if (!group) return {};
        Dictionary map = _engine.conduitObjectForKey("CXDCX", "priorState");
        const UniqueId guid = cxUIDWithTableName(group->sharingUniqueId(), "CXGroup");
        auto locations = group->multiValueForProperty(kCXRemoteLocationProperty);
        if (!locations || locations->empty())
            locations = _database.allGroup()->multiValueForProperty(kCXRemoteLocationProperty);
        if (!locations || locations->empty()) return {};
        const RemoteLocation location(locations->valueAtIndex(0).string());
        const UserName user = _engine.userForRemoteLocation(location);
        const Value prior = map.dictionaryFor(user.str())[guid.str()];
        Dictionary current;
        Array members, subgroups;
        for (const auto& member : group->members()) members.append(cxNormalizedUID(member->sharingUniqueId()));
        for (const auto& subgroup : group->subgroups()) subgroups.append(cxNormalizedUID(subgroup->sharingUniqueId()));
        current.set("memberUIDState", members);
        current.set("subgroupUIDState", subgroups);
        if (const Value name = group->valueForProperty(kCXGroupNameProperty)) current.set(kCXGroupNameProperty, name);
        for (const char* property : {kCXReadWriteSharingACLProperty, kCXReadSharingACLProperty})
            if (const auto list = group->multiValueForProperty(property)) current.set(property, list->_allValues());
        Dictionary lists;
        for (const auto& member : group->members()) {
            Dictionary choices;
            for (const auto& property : member->cxUsedProperties())
                if (const auto chosen = group->distributionIdentifierForProperty(property, member))
                    choices.set(property, *chosen);
            lists.set(cxUIDWithTableName(member->uniqueId(), "CXPerson").str(), choices);
        }
        current.set("distributionListState", lists);
        return compare(prior, current, guid, location);
    }

private:
    CXDChangeRecords compare(const Value& priorValue, const Dictionary& current, const UniqueId& guid,
                             const RemoteLocation& location) {
        CXDChangeRecords all;
        const UserName user = _engine.userForRemoteLocation(location);
        const int32_t mask = syncSourceForRemoteLocation(location);
        const bool isAll = guid.str() == "AllCXGroup";
        const Dictionary prior = priorValue.dictionary();
        if (!priorValue) {
            Dictionary payload;
            if (const Value name = current[kCXGroupNameProperty]) payload.set(kCXGroupNameProperty, name);
            add(all, CXDCreateStructureForGroup, user, {}, guid, payload, mask);
            const auto allGroup = user == kSelf ? _database.allGroup() : _database.allGroupForRemoteLocation(location);
            const auto allUID = allGroup ? std::optional(allGroup->sharingUniqueId()) : std::nullopt;
            if (guid != allUID) add(all, CXDAddGroupToGroup, user, guid, allUID, {}, mask);
        }
        for (const auto& added : missing(current["memberUIDState"], prior["memberUIDState"])) {
            append(all, changesForPerson(std::dynamic_pointer_cast<CXPerson>(find(added)), true));
            add(all, CXDAddRecordToGroup, user, added, guid, {}, mask);
        }
        for (const auto& removed : missing(prior["memberUIDState"], current["memberUIDState"])) {
            if (isAll) add(all, CXDDeleteRecord, user, removed, {}, {}, mask);
            add(all, CXDRemoveRecordFromGroup, user, removed, guid, {}, mask);
            add(all, CXDRemoveDistributionListFromGroup, user, removed, guid, {}, mask);
        }
        for (const auto& added : missing(current["subgroupUIDState"], prior["subgroupUIDState"])) {
            append(all, changesForGroup(std::dynamic_pointer_cast<CXGroup>(_database.recordForUniqueId(added))));
            add(all, CXDAddGroupToGroup, user, added, guid, {}, mask);
        }
        for (const auto& removed : missing(prior["subgroupUIDState"], current["subgroupUIDState"])) {
            if (isAll) add(all, CXDDeleteGroup, user, {}, removed, {}, mask);
            add(all, CXDRemoveGroupFromGroup, user, removed, guid, {}, mask);
        }
        const std::string name = current[kCXGroupNameProperty].string();
        if (!(prior[kCXGroupNameProperty].isString() && prior[kCXGroupNameProperty].string() == name) && !isAll)
            add(all, CXDChangeGroupName, user, {}, guid, name, mask);
        if (user == kSelf) {
            accessList(all, CXDChangeGroupReadWriteACL, kCXReadWriteSharingACLProperty, prior, current, guid, mask);
            accessList(all, CXDChangeGroupReadACL, kCXReadSharingACLProperty, prior, current, guid, mask);
        }
        if (isAll) return all;
        for (const auto& [person, choices] : current["distributionListState"].dictionary())
            if (prior["distributionListState"].dictionary()[person] != choices)
                add(all, CXDUpdateDistributionList, user, UniqueId(person), guid, choices, mask);
        return all;
    }

    void accessList(CXDChangeRecords& all, CXDChangeType type, const char* property, const Dictionary& prior,
                    const Dictionary& current, const UniqueId& guid, int32_t mask) {
        Array additions, deletions;
        for (const auto& one : missing(current[property], prior[property])) additions.append(one);
        for (const auto& one : missing(prior[property], current[property])) deletions.append(one);
        if (!additions.empty() || !deletions.empty())
            add(all, type, kSelf, {}, guid, Dictionary{{"additions", additions}, {"deletions", deletions}}, mask);
    }

    static std::vector<UniqueId> missing(const Value& from, const Value& in) {
        std::vector<UniqueId> all;
        for (const Value& one : from.array()) {
            bool found = false;
            for (const Value& other : in.array()) found = found || other == one;
            if (!found) all.emplace_back(one.string());
        }
        return all;
    }

    CXRecordRef find(const UniqueId& uid) {
        if (auto copy = _database.recordForUniqueId(cxUIDWithTableName(uid, "CXSubscribedPerson"))) return copy;
        return _database.recordForUniqueId(cxUIDWithTableName(uid, "CXPerson"));
    }

    static void append(CXDChangeRecords& all, const CXDChangeRecords& more) {
        all.insert(all.end(), more.begin(), more.end());
    }
    static void add(CXDChangeRecords& all, CXDChangeType type, const UserName& user, std::optional<UniqueId> person,
                    std::optional<UniqueId> group, const Value& payload, int32_t mask) {
        all.push_back(std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, user, person, group, payload));
        all.back()->setAppliesToSources(mask);
    }

    FakeEngine& _engine;
    CXRolvane& _database;
};

} // namespace rolvane::test
