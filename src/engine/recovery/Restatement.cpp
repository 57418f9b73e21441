#include "engine/recovery/Restatement.h"

#include "conduits/CXDConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/CXGroup.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/recovery/Holdings.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"

#include <algorithm>
#include <functional>
#include <iterator>
#include <set>
#include <utility>

namespace rolvane {

namespace {

bool putsGroupThere(const CXDChangeRecord& record) {
    switch (record.type()) {
    case CXDCreateStructureForGroup:
    case CXDCompositeGroupChange:
    case CXDChangeGroupName:
    case CXDAddRecordToGroup:
    case CXDAddGroupToGroup:
    case CXDUpdateDistributionList: return record.group().has_value();
    default: return false;
    }
}

CXDChangeRecordPtr removal(const CXDChangeRecord& of, CXDChangeType type, const std::optional<UniqueId>& person,
                           const std::optional<UniqueId>& group) {
    auto record = std::make_shared<CXDChangeRecord>(of.initialSource(), type, of.user(), person, group);
    record->setAppliesToSources(of.appliesToSources());
    return record;
}

// Who was to be put into a group and is gone, with what puts that right: their file may have been written before.
void withdrawMembers(const CXDChangeRecord& composite, Holdings& holdings, CXDChangeRecords& removals) {
    const Value content = composite.inMemoryPayload();
    if (!content.isDictionary()) return;
    const Dictionary payload = content.dictionary();
    for (const Value& name : payload[kMemberAdds].array())
        if (const UniqueId person(name.string()); !holdings.person(person)) {
            removals.push_back(removal(composite, CXDRemoveRecordFromGroup, person, composite.group()));
            removals.push_back(removal(composite, CXDDeleteRecord, person, std::nullopt));
        }
    for (const Value& name : payload[kSubgroupAdds].array())
        if (const UniqueId group(name.string()); !holdings.group(group)) {
            removals.push_back(removal(composite, CXDRemoveGroupFromGroup, group, composite.group()));
            removals.push_back(removal(composite, CXDDeleteGroup, std::nullopt, group));
        }
}

// A change of a group's name, members, rights or choices, for the owner's store alone; its deletion is none. Copies of
// somebody else's contacts may be older than their publisher's store, and are not compared for it.
bool isOfGroup(const CXDChangeRecord& record) {
    return record.initialSource() == CXDSyncSourceCX && record.appliesToSources() == CXDSyncSourceVaultra &&
           record.user() == kSelf && record.group() && *record.group() != kPeopleGroup &&
           record.type() != CXDDeleteGroup;
}

} // namespace

void Restatement::withdrawWhatIsGone(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("what is gone")) return;
    Holdings holdings(rolvane);
    CXDChangeRecords removals;
    for (size_t i = fresh; i < records.size(); ++i) {
        const CXDChangeRecord& record = *records[i];
        if (record.initialSource() != CXDSyncSourceCX || !record.user() || !hasCopies(*record.user())) continue;
        if (record.type() == CXDUpdateRecord && record.person() && !holdings.person(*record.person()))
            records[i] = removal(record, CXDDeleteRecord, record.person(), std::nullopt);
        else if (putsGroupThere(record) && !holdings.group(*record.group()))
            records[i] = removal(record, CXDDeleteGroup, std::nullopt, record.group());
        else if (record.type() == CXDCompositeGroupChange && record.group())
            withdrawMembers(record, holdings, removals);
    }
    for (CXDChangeRecordPtr& record : removals) records.push_back(std::move(record));
}

void Restatement::dropRemovalsOfWhatIsBack(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("what is back")) return;
    const auto found = [&](const UniqueId& uid, std::string_view table) {
        return rolvane.recordForUniqueId(cxUIDWithTableName(uid, table));
    };
    const auto isBack = [&](const CXDChangeRecordPtr& record) {
        if (record->initialSource() != CXDSyncSourceCX || !record->changeMadeByDataOwner()) return false;
        if (record->type() == CXDDeleteRecord) return record->person() && found(*record->person(), kCXPersonTable);
        if (record->type() != CXDDeleteGroup || !record->group() || record->group()->str() == kCXAllGroupUID)
            return false;
        const auto group = std::dynamic_pointer_cast<CXGroup>(found(*record->group(), kCXGroupTable));
        return group && (isPublished(*rolvane.allGroup()) || isPublished(*group)); // a withdrawn one stays here, too
    };
    const auto queue = records.begin() + static_cast<std::ptrdiff_t>(fresh);
    records.erase(std::remove_if(queue, records.end(), isBack), records.end());
}

CXDChangeRecords Restatement::compareGroups(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("restated groups")) return {};
    std::set<std::pair<UserName, UniqueId>> groups;
    for (size_t i = fresh; i < records.size(); ++i)
        if (isOfGroup(*records[i]))
            groups.emplace(*records[i]->user(), cxUIDWithTableName(*records[i]->group(), kCXGroupTable));
    CXDChangeRecords now;
    std::erase_if(groups, [&](const auto& of) {
        auto changes = database.changesOfGroupNow(of.first, of.second);
        if (!changes) return true;
        std::move(changes->begin(), changes->end(), std::back_inserter(now));
        return false;
    });
    const auto queue = records.begin() + static_cast<std::ptrdiff_t>(fresh);
    const auto isRestated = [&](const CXDChangeRecordPtr& record) {
        return isOfGroup(*record) &&
               groups.contains({*record->user(), cxUIDWithTableName(*record->group(), kCXGroupTable)});
    };
    const auto restated = std::stable_partition(queue, records.end(), std::not_fn(isRestated));
    CXDChangeRecords before(std::make_move_iterator(restated), std::make_move_iterator(records.end()));
    records.erase(restated, records.end());
    std::move(now.begin(), now.end(), std::back_inserter(records));
    return before;
}

CXDChangeRecords Restatement::restate(CXDChangeRecords& records, size_t fresh) const {
    if (records.size() <= fresh) return {};
    withdrawWhatIsGone(records, fresh);
    dropRemovalsOfWhatIsBack(records, fresh);
    return compareGroups(records, fresh);
}

} // namespace rolvane
