#include "engine/pass/PassRefusals.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PriorStates.h"
#include "engine/queue/ChangeQueue.h"
#include "engine/queue/RefusedChanges.h"
#include "engine/recovery/UnderWay.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <optional>
#include <string_view>
#include <vector>

namespace rolvane {

namespace {

// News have taken contacts or groups away before the store said that they left this group, too. So they have left the
// copy of the group, and nobody has edited that.
bool isDeletionByNews(CXDChangeRecord& record, CXRolvane& rolvane) {
    if (record.type() != CXDCompositeGroupChange || isListOfEverybody(record)) return false;
    const Dictionary payload = record.payload().dictionary();
    const auto isEmpty = [&](const char* part) {
        const Value& value = payload[part];
        return value.isArray() ? value.array().empty() : value.dictionary().empty() && !value.isString();
    };
    for (const char* part : {kMemberAdds, kSubgroupAdds, kDistributionListAdds, kCXGroupNameProperty})
        if (!isEmpty(part)) return false;
    const Array people = payload[kMemberRemoves].array(), groups = payload[kSubgroupRemoves].array();
    const auto isGone = [&](const Value& name, std::string_view table) {
        return !rolvane.recordForUniqueId(cxUIDWithTableName(UniqueId(name.string()), table));
    };
    return (!people.empty() || !groups.empty()) &&
           std::all_of(people.begin(), people.end(),
                       [&](const Value& name) { return isGone(name, kCXSubscribedPersonTable); }) &&
           std::all_of(groups.begin(), groups.end(),
                       [&](const Value& name) { return isGone(name, kCXSubscribedGroupTable); });
}

} // namespace

bool isGivenUp(EngineParts& parts, const CXDChangeRecord& record) {
    const bool isOfCopy = record.initialSource() == CXDSyncSourceCX && !record.changeMadeByDataOwner();
    return !isOfCopy && parts.denied.contains(record);
}

void PassRefusals::cancelLike(const CXDChangeRecordPtr& refused, const CXDChangeRecords& others) {
    const bool walk = refused->user() && _cancelledUsers.insert(*refused->user()).second;
    _parts.denied.cancelLike(refused, walk ? others : CXDChangeRecords());
}

void PassRefusals::note() {
    if (_parts.denied.empty()) return;
    _parts.state.withConduitData([&](Dictionary& data) {
        noteRefusedChanges(
            data, _parts.denied.all(), _parts.denied.refused(),
            [&](const CXDChangeRecord& record) { return _parts.conduits.vaultra->findsAgain(record); },
            _parts.with.clock.now());
    });
}

void PassRefusals::tell() {
    const Date now = _parts.with.clock.now();
    std::vector<Refusal> refused = _parts.state.takeRefused();
    for (const UserName& user : ofCopies()) refused.push_back({user});
    const CXDChangeRecords denied = _parts.denied.all();
    const bool ofOwn =
        std::any_of(denied.begin(), denied.end(), [](const CXDChangeRecordPtr& record) { return isOwnWrite(*record); });
    if (!refused.empty()) _parts.state.noteRefusedChanges(refused, now);
    size_t waiting = 0;
    _parts.state.withConduitData([&](Dictionary& data) {
        if (!ofOwn) settleRefusedChanges(data, now);
        if (hasRefusedChanges(data)) waiting = countRefusedChanges(data);
    });
    _parts.outcomes.rests(kSelf, static_cast<int64_t>(waiting));
    _parts.state.noteRefusedByOwnStore(waiting, ofOwn ? std::optional(now) : std::nullopt);
}

std::vector<UserName> PassRefusals::ofCopies() const {
    std::vector<UserName> users;
    for (const CXDChangeRecordPtr& record : _parts.denied.all())
        if (!isOwnWrite(*record) && !isDeletionByNews(*record, _parts.with.rolvane))
            users.push_back(record->user().value_or(UserName()));
    return users;
}

void PassRefusals::takeBack() {
    for (const CXDChangeRecordPtr& record : _parts.denied.all()) takeBack(*record);
}

void PassRefusals::takeBack(const CXDChangeRecord& record) {
    if (isLeftOut("taking back")) return;
    if (record.initialSource() != CXDSyncSourceCX || record.changeMadeByDataOwner() || !record.user()) return;
    _parts.conduits.vaultra->wasRefused(record);
    if (!record.group()) return;
    _parts.state.withConduitData([&](Dictionary& data) {
        const Dictionary groups =
            data[kConduitVaultra].dictionary()[kPriorState].dictionary()[record.user()->str()].dictionary();
        if (groups.contains(cxUIDWithTableName(*record.group(), kCXGroupTable).str()))
            updateCache(data, CXDSyncSourceVaultra, record);
    });
}

} // namespace rolvane
