#include "engine/pass/PassRefusals.h"

#include "contacts/records/Identifier.h"
#include "engine/memory/PublicationCache.h"
#include "engine/queue/RefusedChanges.h"
#include "engine/recovery/UnderWay.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <optional>
#include <vector>

namespace rolvane {

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
    bool ofOwn = false;
    for (const CXDChangeRecordPtr& record : _parts.denied.all())
        if (isOwnWrite(*record))
            ofOwn = true;
        else
            refused.push_back({record->user().value_or(UserName())});
    if (!refused.empty()) _parts.state.noteRefusedChanges(refused, now);
    size_t waiting = 0;
    _parts.state.withConduitData([&](Dictionary& data) {
        if (!ofOwn) settleRefusedChanges(data, now);
        if (hasRefusedChanges(data)) waiting = countRefusedChanges(data);
    });
    _parts.outcomes.rests(kSelf, static_cast<int64_t>(waiting));
    _parts.state.noteRefusedByOwnStore(waiting, ofOwn ? std::optional(now) : std::nullopt);
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
