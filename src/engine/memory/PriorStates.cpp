#include "engine/memory/PriorStates.h"

#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <optional>

namespace rolvane {

namespace {

const char* conduitOf(int32_t source) {
    switch (source) {
    case CXDSyncSourceCX: return kConduitCX;
    case CXDSyncSourceLocal: return kConduitLocal;
    case CXDSyncSourceVaultra: return kConduitVaultra;
    default: return nullptr;
    }
}

std::optional<UniqueId> normalisedPerson(const CXDChangeRecord& record) {
    if (!record.person()) return std::nullopt;
    const bool isSubgroup = record.type() == CXDAddGroupToGroup || record.type() == CXDRemoveGroupFromGroup;
    return cxUIDWithTableName(*record.person(), isSubgroup ? kCXGroupTable : kCXPersonTable);
}

void appendOnce(Array list, const Value& element) {
    if (!list.contains(element)) list.append(element);
}

void appendEach(Array list, const Value& elements) {
    const Array* added = elements.arrayIf();
    if (!added) return;
    for (const Value& element : *added) list.append(element);
}

void removeEach(Array list, const Value& elements) {
    if (const Array* removed = elements.arrayIf()) list.removeAllOf(*removed);
}

void removeOne(const Value& list, const std::optional<UniqueId>& element) {
    if (const Array* elements = list.arrayIf(); elements && element) Array(*elements).removeAll(*element);
}

// The state under the group, or nothing when there is none yet: some changes do not make one.
std::optional<Dictionary> existingState(const Dictionary& users, const std::string& group) {
    const Dictionary* state = users[group].dictionaryIf();
    return state ? std::optional(*state) : std::nullopt;
}

void foldStructure(Dictionary& state, const CXDChangeRecord& record, const std::optional<UniqueId>& person) {
    Array members = state.arrayFor(kMemberUIDState);
    Array subgroups = state.arrayFor(kSubgroupUIDState);
    if (record.type() == CXDAddGroupToGroup) {
        if (person) appendOnce(subgroups, *person);
        return;
    }
    const bool named = record.type() == CXDCreateStructureForGroup || record.type() == CXDChangeGroupName;
    const Value payload = named ? record.inMemoryPayload() : Value();
    if (record.type() == CXDCreateStructureForGroup)
        if (const Value& name = payload.dictionary()[kCXGroupNameProperty]) state.set(kCXGroupNameProperty, name);
    if (person)
        appendOnce(members, *person);
    else if (record.type() == CXDChangeGroupName && payload)
        state.set(kCXGroupNameProperty, payload);
}

void foldComposite(Dictionary& state, const Dictionary& payload) {
    Array members = state.arrayFor(kMemberUIDState);
    Array subgroups = state.arrayFor(kSubgroupUIDState);
    Dictionary distribution = state.dictionaryFor(kDistributionListState);
    appendEach(members, payload[kMemberAdds]);
    removeEach(members, payload[kMemberRemoves]);
    appendEach(subgroups, payload[kSubgroupAdds]);
    removeEach(subgroups, payload[kSubgroupRemoves]);
    if (const Dictionary* added = payload[kDistributionListAdds].dictionaryIf()) distribution.addEntriesFrom(*added);
    if (const Array* removed = payload[kDistributionListRemoves].arrayIf())
        for (const Value& person : *removed) distribution.remove(person.string());
    if (const Value& name = payload[kCXGroupNameProperty]) state.set(kCXGroupNameProperty, name);
}

void foldAccessList(Dictionary& state, const CXDChangeRecord& record) {
    const bool readers = record.type() == CXDChangeGroupReadACL;
    Array principals = state.arrayFor(readers ? kCXReadSharingACLProperty : kCXReadWriteSharingACLProperty);
    const Dictionary payload = record.inMemoryPayload().dictionary();
    appendEach(principals, payload[kAdditions]);
    removeEach(principals, payload[kDeletions]);
}

void foldIntoExisting(Dictionary& state, const CXDChangeRecord& record, const std::optional<UniqueId>& person) {
    switch (record.type()) {
    case CXDRemoveRecordFromGroup: removeOne(state[kMemberUIDState], person); break;
    case CXDRemoveGroupFromGroup: removeOne(state[kSubgroupUIDState], person); break;
    case CXDUpdateDistributionList: {
        Dictionary distribution = state.dictionaryFor(kDistributionListState);
        if (const Value payload = record.inMemoryPayload(); payload && person) distribution.set(person->str(), payload);
        break;
    }
    default: foldAccessList(state, record); break;
    }
}

} // namespace

void updateCache(Dictionary& conduitData, int32_t source, const CXDChangeRecord& record) {
    const char* conduit = conduitOf(source);
    if (!conduit || !record.user()) return;
    Dictionary groups =
        conduitData.dictionaryFor(conduit).dictionaryFor(kPriorState).dictionaryFor(record.user()->str());
    if (!record.group()) return;
    const std::string group = cxUIDWithTableName(*record.group(), kCXGroupTable).str();
    const std::optional<UniqueId> person = normalisedPerson(record);

    switch (record.type()) {
    case CXDCreateStructureForGroup:
    case CXDChangeGroupName:
    case CXDAddRecordToGroup:
    case CXDAddGroupToGroup: {
        Dictionary state = groups.dictionaryFor(group);
        foldStructure(state, record, person);
        break;
    }
    case CXDCompositeGroupChange: {
        Dictionary state = groups.dictionaryFor(group);
        foldComposite(state, record.inMemoryPayload().dictionary());
        break;
    }
    case CXDDeleteGroup: groups.remove(group); break;
    case CXDRemoveRecordFromGroup:
    case CXDRemoveGroupFromGroup:
    case CXDUpdateDistributionList:
    case CXDChangeGroupReadACL:
    case CXDChangeGroupReadWriteACL:
        if (std::optional<Dictionary> state = existingState(groups, group)) foldIntoExisting(*state, record, person);
        break;
    default: break;
    }
}

void didApplyChange(Dictionary& conduitData, const CXDChangeRecord& record, int32_t source) {
    updateCache(conduitData, source, record);
    if (record.initialSource() != source) updateCache(conduitData, record.initialSource(), record);
}

int32_t sourcesForGUID(const Dictionary& conduitData, const UniqueId& group) {
    int32_t sources = 0;
    for (const auto& [conduit, data] : conduitData) {
        const int32_t bit = conduit == kConduitVaultra ? CXDSyncSourceVaultra
                            : conduit == kConduitLocal ? CXDSyncSourceLocal
                                                       : 0;
        const Dictionary* conduitEntries = data.dictionaryIf();
        const Dictionary* users = conduitEntries ? (*conduitEntries)[kPriorState].dictionaryIf() : nullptr;
        if (!users) continue;
        for (const auto& [user, groups] : *users) {
            const Dictionary* states = groups.dictionaryIf();
            if (!states || !states->contains(group.str())) continue;
            sources |= bit;
            break;
        }
    }
    return sources;
}

bool isGUIDPublished(const Dictionary& conduitData, const UniqueId& group) {
    for (const auto& [conduit, data] : conduitData)
        if (data.dictionary()[kPriorState].dictionary()[kSelf.str()].dictionary().contains(group.str())) return true;
    return false;
}

void removeGUID(Dictionary& conduitData, const UniqueId& group) {
    for (const auto& [conduit, data] : conduitData) {
        const Dictionary* conduitEntries = data.dictionaryIf();
        const Dictionary* users = conduitEntries ? (*conduitEntries)[kPriorState].dictionaryIf() : nullptr;
        if (!users) continue;
        for (const auto& [user, groups] : *users)
            if (Dictionary states = groups.dictionary(); groups.isDictionary()) states.remove(group.str());
    }
}

} // namespace rolvane
