#include "engine/queue/TakenOut.h"

#include "contacts/records/Identifier.h"
#include "engine/queue/ChangeQueue.h"
#include "foundation/Log.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"

#include <algorithm>
#include <set>

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

bool isRemoval(const CXDChangeRecord& record) {
    return record.type() & kCXDRemovalBit;
}

std::pair<UserName, UniqueId> shared(const CXDChangeRecord& record, const UniqueId& uid) {
    return {record.user().value_or(UserName()), cxNormalizedUID(uid)};
}

} // namespace

TakenOut::TakenOut(const CXDChangeRecords& records) {
    for (const CXDChangeRecordPtr& record : records)
        if (const auto& uid = takenOutBy(*record); uid && record->appliesToSources() != CXDSyncSourceLocal)
            _sources[shared(*record, *uid)] |= record->initialSource();
}

bool TakenOut::isTakenOutByOthers(const CXDChangeRecord& record, const std::optional<UniqueId>& uid) const {
    if (!uid) return false;
    const auto it = _sources.find(shared(record, *uid));
    return it != _sources.end() && (it->second & ~record.initialSource());
}

bool TakenOut::concerns(const CXDChangeRecord& record) const {
    if (_sources.empty()) return false;
    if (isTakenOutByOthers(record, record.group())) return !takenOutBy(record);
    return !isRemoval(record) && isTakenOutByOthers(record, record.person());
}

// The store's list of everybody has lost the member, and a group there still names it, or a number of it.
bool TakenOut::isLeftBehindThere(const CXDChangeRecord& record) const {
    if (record.initialSource() != CXDSyncSourceVaultra || isRemoval(record) || !record.person()) return false;
    const auto it = _sources.find(shared(record, *record.person()));
    return it != _sources.end() && (it->second & CXDSyncSourceVaultra);
}

std::vector<GroupThatIsGone> TakenOut::drop(CXDChangeRecords& records) const {
    if (_sources.empty() || isLeftOut("deletions win")) return {};
    std::set<GroupThatIsGone> changedHere;
    std::erase_if(records, [&](const CXDChangeRecordPtr& record) {
        const bool isFromHere = record->initialSource() == CXDSyncSourceCX;
        if (isLeftBehindThere(*record)) {
            CXDLog("Rejecting %@", record);
            return true;
        }
        if (!concerns(*record)) {
            if (record->type() == CXDCompositeGroupChange) forgetAdditions(*record);
            return false;
        }
        if (!isFromHere && !record->changeMadeByDataOwner()) return false;
        CXDLog("Rejecting %@", record);
        if (isFromHere && record->user() && isTakenOutByOthers(*record, record->group()))
            changedHere.insert({*record->user(), cxNormalizedUID(*record->group())});
        return true;
    });
    return {changedHere.begin(), changedHere.end()};
}

// A waiting change of a group names members that nobody has any longer.
void TakenOut::forgetAdditions(CXDChangeRecord& composite) const {
    const Value content = composite.inMemoryPayload();
    if (!content.isDictionary()) return;
    Dictionary payload = content.dictionary().mutableCopy();
    bool changed = false;
    for (const char* key : {kMemberAdds, kSubgroupAdds}) {
        Array kept;
        for (const Value& name : payload[key].array())
            if (!isTakenOutByOthers(composite, UniqueId(name.string()))) kept.append(name);
        if (kept.count() == payload[key].array().count()) continue;
        payload.set(key, kept);
        changed = true;
    }
    if (changed) composite.setPayload(payload);
}

} // namespace rolvane
