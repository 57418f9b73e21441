#include "engine/recovery/Arrivals.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/records/CXGroup.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PublicationCache.h"

#include <map>
#include <string>
#include <tuple>
#include <unordered_set>

namespace rolvane {

namespace {

constexpr const char* kSource = "source"; // where they came from
constexpr const char* kType = "type";
constexpr const char* kUser = "user";
constexpr const char* kGroup = "group";
constexpr const char* kMembers = "members"; // people or subgroups
constexpr const char* kName = "name";

bool isGroupChange(int32_t type) {
    switch (type) {
    case CXDCreateStructureForGroup:
    case CXDChangeGroupName:
    case CXDAddRecordToGroup:
    case CXDAddGroupToGroup:
    case CXDRemoveRecordFromGroup:
    case CXDRemoveGroupFromGroup:
    case CXDDeleteGroup: return true;
    default: return false;
    }
}

bool isAllGroup(const UniqueId& group) {
    return cxUIDWithTableName(group, kCXGroupTable).str() == kCXAllGroupUID;
}

std::unordered_set<UniqueId> normalised(const std::vector<UniqueId>& identifiers) {
    std::unordered_set<UniqueId> all;
    for (const UniqueId& uid : identifiers) all.insert(cxNormalizedUID(uid));
    return all;
}

// The changes of one kind to one group of one user.
class GroupArrivals {
public:
    GroupArrivals(Dictionary& conduitData, const Dictionary& arrivals, const CXGroupRef& group)
        : _conduitData(conduitData), _arrivals(arrivals), _type(static_cast<int32_t>(arrivals[kType].integer())),
          _group(group) {}

    void fold() {
        switch (_type) {
        case CXDCreateStructureForGroup:
            if (_group)
                fold(std::nullopt, isNamedSo() ? Value(Dictionary{{kCXGroupNameProperty, _arrivals[kName]}}) : Value());
            break;
        case CXDChangeGroupName:
            if (_group && isNamedSo()) fold(std::nullopt, _arrivals[kName]);
            break;
        case CXDDeleteGroup:
            if (!_group) fold(std::nullopt, {});
            break;
        default: foldMembers(); break;
        }
    }

private:
    bool isNamedSo() const { return _arrivals[kName].isString() && _arrivals[kName].string() == _group->name(); }

    void foldMembers() {
        if (!_group) return;
        const bool adds = (_type & kCXDRemovalBit) == 0;
        const bool people = _type == CXDAddRecordToGroup || _type == CXDRemoveRecordFromGroup;
        const auto there = normalised(people ? _group->memberUniqueIds() : _group->subgroupUniqueIds());
        for (const Value& member : _arrivals[kMembers].array()) {
            const UniqueId uid(member.string());
            if (there.contains(cxNormalizedUID(uid)) == adds) fold(uid, {});
        }
    }

    void fold(const std::optional<UniqueId>& member, const Value& payload) {
        const CXDChangeRecord record(static_cast<int32_t>(_arrivals[kSource].integer()), _type,
                                     UserName(_arrivals[kUser].string()), member, UniqueId(_arrivals[kGroup].string()),
                                     payload);
        didApplyChange(_conduitData, record, CXDSyncSourceCX);
    }

    Dictionary& _conduitData;
    const Dictionary& _arrivals;
    const int32_t _type;
    const CXGroupRef _group; // none when it is not there, or is somebody else's
};

CXGroupRef groupOf(CXRolvane& rolvane, const UniqueId& uid, const RemoteLocation& location) {
    if (isAllGroup(uid)) {
        if (location.empty()) return rolvane.allGroup();
        return rolvane.allGroupForRemoteLocation(location);
    }
    auto group = std::dynamic_pointer_cast<CXGroup>(rolvane.recordForUniqueId(uid));
    return group && group->remoteLocation() == location ? group : nullptr;
}

} // namespace

Array arrivalsAmong(const CXDChangeRecords& records, size_t from) {
    // By type first, which is the order in which they are applied.
    std::map<std::tuple<uint32_t, int32_t, UserName, UniqueId>, Dictionary> all;
    for (size_t i = from; i < records.size(); ++i) {
        const CXDChangeRecord& record = *records[i];
        if (!(record.appliesToSources() & CXDSyncSourceCX) || record.initialSource() == CXDSyncSourceCX) continue;
        if (!isGroupChange(record.type()) || !record.group() || !record.user()) continue;
        const auto [found, isNew] = all.try_emplace(
            {static_cast<uint32_t>(record.type()), record.initialSource(), *record.user(), *record.group()});
        Dictionary& arrivals = found->second;
        if (isNew) {
            arrivals.set(kType, record.type());
            arrivals.set(kSource, record.initialSource());
            arrivals.set(kUser, *record.user());
            arrivals.set(kGroup, *record.group());
        }
        if (record.person()) arrivals.arrayFor(kMembers).append(*record.person());
        const Value payload = record.inMemoryPayload();
        const Value& name = payload.isDictionary() ? payload.dictionary()[kCXGroupNameProperty] : payload;
        if (name.isString()) arrivals.set(kName, name);
    }
    Array listed;
    for (const auto& [what, arrivals] : all) listed.append(arrivals);
    return listed;
}

void foldArrivals(Dictionary& conduitData, const Array& arrivals, CXRolvane& rolvane,
                  const LocationOfUser& locationOf) {
    for (const Value& each : arrivals) {
        const Dictionary kind = each.dictionary();
        const auto location = locationOf(UserName(kind[kUser].string()));
        if (!location) continue; // nothing of it is anywhere
        GroupArrivals(conduitData, kind, groupOf(rolvane, UniqueId(kind[kGroup].string()), *location)).fold();
    }
}

} // namespace rolvane
