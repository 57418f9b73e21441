#include "conduits/database/RemovalChanges.h"

#include "contacts/records/Identifier.h"
#include "model/PayloadKeys.h"

#include <algorithm>

namespace rolvane {
namespace {

constexpr size_t kWorthAnIndex = 16;

void add(CXDChangeRecords& records, CXDChangeType type, const std::string& user, std::optional<UniqueId> person,
         std::optional<UniqueId> group) {
    records.push_back(
        std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, UserName(user), std::move(person), std::move(group)));
    records.back()->setAppliesToSources(CXDSyncSourceVaultra);
}

} // namespace

RemovalChanges::RemovalChanges(Dictionary priorState, size_t expectedDeletions)
    : _priorState(std::move(priorState)), _indexed(expectedDeletions >= kWorthAnIndex) {
    if (!_indexed) return;
    _members = indexOf(kMemberUIDState);
    _subgroups = indexOf(kSubgroupUIDState);
}

RemovalChanges::Index RemovalChanges::indexOf(const char* list) const {
    Index index;
    for (const auto& [user, groups] : _priorState)
        for (const auto& [group, state] : groups.dictionary())
            for (const Value& listed : state.dictionary()[list].array()) {
                Mentions& all = index[listed.string()];
                if (!all.empty() && all.back().user == user && all.back().group == group)
                    ++all.back().times;
                else
                    all.push_back({user, group, 1});
            }
    return index;
}

RemovalChanges::Mentions RemovalChanges::mentions(const char* list, const Index& index, const UniqueId& uid) const {
    if (_indexed) {
        const auto found = index.find(uid.str());
        return found == index.end() ? Mentions() : found->second;
    }
    Mentions all;
    for (const auto& [user, groups] : _priorState)
        for (const auto& [group, state] : groups.dictionary()) {
            const Array listed = state.dictionary()[list].array();
            if (!listed.containsString(uid.str())) continue;
            const auto times = std::count(listed.begin(), listed.end(), Value(uid));
            all.push_back({user, group, static_cast<size_t>(times)});
        }
    return all;
}

CXDChangeRecords RemovalChanges::changesToRemovePerson(const UniqueId& person) const {
    CXDChangeRecords records;
    for (const auto& [user, groupText, times] : mentions(kMemberUIDState, _members, person)) {
        const UniqueId group(groupText);
        const bool isAllGroup = groupText == kCXAllGroupUID;
        for (size_t i = 0; i < times; ++i) {
            if (isAllGroup)
                add(records, CXDDeleteRecord, user, person, std::nullopt);
            else
                add(records, CXDRemoveRecordFromGroup, user, person, group);
            add(records, CXDRemoveDistributionListFromGroup, user, person, group);
            if (isAllGroup) add(records, CXDRemoveRecordFromGroup, user, person, group);
        }
    }
    return records;
}

CXDChangeRecords RemovalChanges::changesToRemoveGroup(const UniqueId& group) const {
    CXDChangeRecords records;
    const Mentions parents = mentions(kSubgroupUIDState, _subgroups, group);
    auto parent = parents.begin();
    for (const auto& [user, groups] : _priorState) {
        const Dictionary known = groups.dictionary();
        // The records keep the order of the state: the group itself stands among the groups that list it.
        bool announced = !known.contains(group.str());
        const auto announce = [&, &user = user] {
            add(records, CXDDeleteGroup, user, std::nullopt, group);
            announced = true;
        };
        for (; parent != parents.end() && parent->user == user; ++parent) {
            if (!announced && group.str() < parent->group) announce();
            if (parent->group == group.str()) continue; // its own deletion says it all
            for (size_t i = 0; i < parent->times; ++i)
                add(records, CXDRemoveGroupFromGroup, user, group, UniqueId(parent->group));
        }
        if (!announced) announce();
    }
    return records;
}

} // namespace rolvane
