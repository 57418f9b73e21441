#include "engine/TakenOut.h"

#include "contacts/Identifier.h"
#include "engine/ChangeQueue.h"
#include "foundation/Log.h"
#include "model/PayloadKeys.h"

#include <algorithm>
#include <functional>
#include <set>
#include <unordered_map>
#include <utility>

namespace rolvane {

namespace {

bool isAllGroup(const std::optional<UniqueId>& group) {
    return group && group->str() == kCXAllGroupUID;
}

// Who leaves the all-contacts group leaves the publication.
const std::optional<UniqueId>& takenOutBy(const CXDChangeRecord& record) {
    static const std::optional<UniqueId> nothing;
    switch (record.type()) {
    case CXDDeleteRecord: return record.person();
    case CXDDeleteGroup: return isAllGroup(record.group()) ? nothing : record.group();
    case CXDRemoveRecordFromGroup:
    case CXDRemoveGroupFromGroup: return isAllGroup(record.group()) ? record.person() : nothing;
    default: return nothing;
    }
}

// Of a user's publication, by the identifiers that store and database share.
class TakenOut {
public:
    void add(const CXDChangeRecord& record) {
        if (const auto& uid = takenOutBy(record)) _sources[key(record, *uid)] |= record.initialSource();
    }
    bool empty() const { return _sources.empty(); }
    bool byOtherThan(const CXDChangeRecord& record, const std::optional<UniqueId>& uid) const {
        if (!uid) return false;
        const auto it = _sources.find(key(record, *uid));
        return it != _sources.end() && (it->second & ~record.initialSource());
    }

private:
    using Key = std::pair<UserName, UniqueId>;
    struct Hash {
        size_t operator()(const Key& key) const {
            return std::hash<UserName>{}(key.first) * 31 + std::hash<UniqueId>{}(key.second);
        }
    };
    static Key key(const CXDChangeRecord& record, const UniqueId& uid) {
        return {record.user().value_or(UserName()), cxNormalizedUID(uid)};
    }
    std::unordered_map<Key, int32_t, Hash> _sources; // that take it out
};

bool isRemoval(const CXDChangeRecord& record) {
    return record.type() & kCXDRemovalBit;
}

// A waiting change of a group names members that nobody has any longer.
void forgetAdditions(CXDChangeRecord& composite, const TakenOut& takenOut) {
    const Value content = composite.inMemoryPayload();
    if (!content.isDictionary()) return;
    Dictionary payload = content.dictionary().mutableCopy();
    bool changed = false;
    for (const char* key : {kMemberAdds, kSubgroupAdds}) {
        Array kept;
        for (const Value& name : payload[key].array())
            if (!takenOut.byOtherThan(composite, UniqueId(name.string()))) kept.append(name);
        if (kept.count() == payload[key].array().count()) continue;
        payload.set(key, kept);
        changed = true;
    }
    if (changed) composite.setPayload(payload);
}

} // namespace

std::vector<GroupThatIsGone> dropWhatTheOtherSideTookOut(CXDChangeRecords& records) {
    TakenOut takenOut;
    for (const CXDChangeRecordPtr& record : records) takenOut.add(*record);
    if (takenOut.empty()) return {};

    std::set<GroupThatIsGone> changedHere;
    std::erase_if(records, [&](const CXDChangeRecordPtr& record) {
        const bool ofGroup = takenOut.byOtherThan(*record, record->group());
        const bool isDropped =
            ofGroup ? !takenOutBy(*record) : !isRemoval(*record) && takenOut.byOtherThan(*record, record->person());
        if (!isDropped) {
            if (record->type() == CXDCompositeGroupChange) forgetAdditions(*record, takenOut);
            return false;
        }
        CXDLog("Rejecting %@", record);
        if (ofGroup && record->initialSource() == CXDSyncSourceCX && record->user())
            changedHere.insert({*record->user(), cxNormalizedUID(*record->group())});
        return true;
    });
    return {changedHere.begin(), changedHere.end()};
}

} // namespace rolvane
