#include "engine/queue/PayloadMerging.h"

#include "contacts/records/CXMerger.h"
#include "contacts/records/CXPerson.h"
#include "foundation/Log.h"

#include <vector>

namespace rolvane {

Dictionary payloadMerging(CXMerger& merger, const Dictionary& first, const Dictionary& second) {
    const CXPersonRef card = CXPerson::personFromDictionary(first, nullptr, true, false);
    const CXPersonRef imported = CXPerson::personFromDictionary(second, nullptr, true, false);
    merger.updateCard(*card, *imported);
    return card->dictionaryRepresentation();
}

CXDChangeRecordPtr mingleChangeAmongstChanges(CXMerger& merger, const CXDChangeRecordPtr& record,
                                              CXDChangeRecords& changes) {
    constexpr int32_t everySource = CXDSyncSourceCX | CXDSyncSourceLocal | CXDSyncSourceVaultra;
    if (record->appliesToSources() == 0) record->setAppliesToSources(record->initialSource() ^ everySource);
    for (size_t i = 0; i < changes.size();) {
        const CXDChangeRecordPtr element = changes[i++];
        if (element == record || !record->person() || record->person() != element->person() ||
            record->initialSource() == element->initialSource())
            continue;
        CXDLog("CONFLICT:\n%@\n%@", record, element);
        record->setPayload(payloadMerging(merger, element->payload().dictionary(), record->payload().dictionary()));
        record->setAppliesToSources(record->appliesToSources() | element->initialSource() | record->initialSource());
        std::erase_if(changes, [&](const CXDChangeRecordPtr& each) { return each->isEqual(*element); });
    }
    return record;
}

} // namespace rolvane
