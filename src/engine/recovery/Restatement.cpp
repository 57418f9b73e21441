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
#include <string>
#include <unordered_set>

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
bool isOfOwnGroup(const CXDChangeRecord& record) {
    return record.initialSource() == CXDSyncSourceCX && record.appliesToSources() == CXDSyncSourceVaultra &&
           record.user() == kSelf && record.group() && *record.group() != kPeopleGroup &&
           record.type() != CXDDeleteGroup;
}

// Of a group in a writer's copies.
bool isOfCopiedGroup(const CXDChangeRecord& record) {
    return record.initialSource() == CXDSyncSourceCX && record.appliesToSources() == CXDSyncSourceVaultra &&
           record.user() && *record.user() != kSelf && record.group() && *record.group() != kPeopleGroup &&
           (record.type() == CXDCompositeGroupChange || record.type() == CXDChangeGroupName);
}

// The change of a list of everybody without the removal of people who are there again.
CXDChangeRecordPtr withoutRemovals(const CXDChangeRecordPtr& record,
                                   const std::function<bool(const UniqueId& person)>& isThere) {
    const Value content = record->inMemoryPayload();
    if (!content.isDictionary()) return record;
    Array kept;
    for (const Value& each : content.dictionary()[kMemberRemoves].array())
        if (!isThere(UniqueId(each.string()))) kept.append(each);
    if (kept.count() == content.dictionary()[kMemberRemoves].array().count()) return record;
    Dictionary now = content.dictionary().mutableCopy();
    now.set(kMemberRemoves, kept);
    const CXDChangeRecordPtr rest = record->copy();
    rest->setPayload(now);
    return rest;
}

// The change of another group without those parts that the person has taken back; null where nothing is left of it.
CXDChangeRecordPtr whatIsTrueStill(const CXDChangeRecordPtr& record, const CXGroup& group) {
    const auto isFormer = [&](const Value& given) { return given.isString() && given.string() != group.name(); };
    const Value content = record->inMemoryPayload();
    if (record->type() == CXDChangeGroupName) return isFormer(content) ? nullptr : record;
    if (!content.isDictionary()) return record;
    std::unordered_set<std::string> members;
    for (const UniqueId& uid : group.memberUniqueIds()) members.insert(cxNormalizedUID(uid).str());
    for (const UniqueId& uid : group.subgroupUniqueIds()) members.insert(cxNormalizedUID(uid).str());
    Dictionary now = content.dictionary().mutableCopy();
    bool differs = false;
    const auto keep = [&](const char* list, bool areMembers) {
        Array kept;
        for (const Value& each : now[list].array())
            if (members.contains(each.string()) == areMembers) kept.append(each);
        if (kept.count() == now[list].array().count()) return;
        now.set(list, kept);
        differs = true;
    };
    for (const char* list : {kMemberAdds, kSubgroupAdds}) keep(list, true);
    for (const char* list : {kMemberRemoves, kSubgroupRemoves}) keep(list, false);
    if (isFormer(now[kCXGroupNameProperty])) {
        now.remove(kCXGroupNameProperty);
        differs = true;
    }
    if (!differs) return record;
    const CXDChangeRecordPtr rest = record->copy();
    rest->setPayload(now);
    return rest;
}

} // namespace

void Restatement::withdrawWhatIsGone(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("what is gone")) return;
    Holdings holdings(rolvane, records, fresh);
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

// News may have brought a copy back, too, before its removal was sent.
bool Restatement::isCopyMadeAgain(const UniqueId& person) const {
    const auto row = rolvane.personRow(cxUIDWithTableName(person, kCXSubscribedPersonTable));
    return row && !row->writer.empty() && row->writer != rolvane.programName();
}

void Restatement::dropRemovalsOfWhatIsBack(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("what is back")) return;
    const auto found = [&](const UniqueId& uid, std::string_view table) {
        return rolvane.recordForUniqueId(cxUIDWithTableName(uid, table));
    };
    const auto isBack = [&](const CXDChangeRecordPtr& record) {
        if (record->initialSource() != CXDSyncSourceCX || !record->user()) return false;
        const bool isOwn = record->changeMadeByDataOwner();
        if (record->type() == CXDDeleteRecord && record->person())
            return isOwn ? found(*record->person(), kCXPersonTable) != nullptr : isCopyMadeAgain(*record->person());
        if (!isOwn || record->type() != CXDDeleteGroup || !record->group() || record->group()->str() == kCXAllGroupUID)
            return false;
        const auto group = std::dynamic_pointer_cast<CXGroup>(found(*record->group(), kCXGroupTable));
        return group && (isPublished(*rolvane.allGroup()) || isPublished(*group)); // a withdrawn one stays here, too
    };
    const auto queue = records.begin() + static_cast<std::ptrdiff_t>(fresh);
    records.erase(std::remove_if(queue, records.end(), isBack), records.end());
}

void Restatement::compareGroups(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("restated groups")) return;
    std::set<UniqueId> groups;
    for (size_t i = fresh; i < records.size(); ++i)
        if (isOfOwnGroup(*records[i])) groups.insert(cxUIDWithTableName(*records[i]->group(), kCXGroupTable));
    CXDChangeRecords now;
    std::erase_if(groups, [&](const UniqueId& group) {
        auto changes = database.changesOfGroupNow(group);
        if (!changes) return true;
        std::move(changes->begin(), changes->end(), std::back_inserter(now));
        return false;
    });
    const auto isRestated = [&](const CXDChangeRecordPtr& record) {
        return isOfOwnGroup(*record) && groups.contains(cxUIDWithTableName(*record->group(), kCXGroupTable));
    };
    const auto queue = records.begin() + static_cast<std::ptrdiff_t>(fresh);
    records.erase(std::remove_if(queue, records.end(), isRestated), records.end());
    std::move(now.begin(), now.end(), std::back_inserter(records));
}

void Restatement::dropWhatAWriterUndid(CXDChangeRecords& records, size_t fresh) const {
    if (isLeftOut("what a writer undid")) return;
    for (size_t i = fresh; i < records.size(); ++i) {
        if (!isOfCopiedGroup(*records[i]) || !hasCopies(*records[i]->user())) continue;
        const UniqueId shared = cxUIDWithTableName(*records[i]->group(), kCXGroupTable);
        if (shared.str() == kCXAllGroupUID) {
            records[i] = withoutRemovals(records[i], [&](const UniqueId& person) { return isCopyMadeAgain(person); });
        } else if (const auto group = std::dynamic_pointer_cast<CXGroup>(
                       rolvane.recordForUniqueId(cxUIDWithTableName(shared, kCXSubscribedGroupTable)))) {
            records[i] = whatIsTrueStill(records[i], *group);
        }
    }
    std::erase(records, nullptr);
}

void Restatement::restate(CXDChangeRecords& records, size_t fresh) const {
    if (records.size() <= fresh) return;
    withdrawWhatIsGone(records, fresh);
    dropRemovalsOfWhatIsBack(records, fresh);
    dropWhatAWriterUndid(records, fresh);
    compareGroups(records, fresh);
}

} // namespace rolvane
