#include "engine/pass/ArrivedContacts.h"

#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PassCommit.h"
#include "engine/memory/PriorStates.h"
#include "foundation/TestSwitch.h"

#include <utility>

namespace rolvane {

void ArrivedContacts::note(const CXDChangeRecordPtr& applied) {
    const bool isArrival = applied->type() == CXDUpdateRecord
                               ? applied->person().has_value()
                               : applied->type() == CXDCreateStructureForGroup && applied->group().has_value();
    if (isArrival && applied->user()) _arrived.push_back(applied);
}

void ArrivedContacts::save(const CXDChangeRecords& toCome, size_t next) {
    PassCommit commit(_parts.with.rolvane, _parts.with.preferences, _parts.state);
    claimState(_parts);
    list(toCome, next);
    _parts.state.putConduitDataWith(_parts.marksOfThePass);
    commit.commit();
}

void ArrivedContacts::list(const CXDChangeRecords& toCome, size_t next) {
    if (isLeftOut("listing of what arrived")) return;
    if (!_listings) {
        _listings.emplace();
        for (size_t i = next; i < toCome.size(); ++i) {
            const CXDChangeRecord& record = *toCome[i];
            const bool lists = record.type() == CXDAddRecordToGroup || record.type() == CXDAddGroupToGroup;
            if (lists && (record.appliesToSources() & CXDSyncSourceCX) && record.initialSource() != CXDSyncSourceCX &&
                record.user() && record.person() && record.group() &&
                cxUIDWithTableName(*record.group(), kCXGroupTable).str() == kCXAllGroupUID)
                _listings->emplace(std::pair(*record.user(), cxNormalizedUID(*record.person())), toCome[i]);
        }
    }
    for (const CXDChangeRecordPtr& record : std::exchange(_arrived, {})) {
        const UniqueId& who = record->type() == CXDUpdateRecord ? *record->person() : *record->group();
        const auto listing = _listings->find({*record->user(), cxNormalizedUID(who)});
        if (listing == _listings->end() || !_parts.conduits.cx->holds(*listing->second)) continue;
        _parts.state.withConduitData(
            [&](Dictionary& data) { didApplyChange(data, *listing->second, CXDSyncSourceCX); });
    }
}

} // namespace rolvane
