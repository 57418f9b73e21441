#include "engine/ChangeQueue.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"

#include <algorithm>
#include <unordered_map>
#include <vector>

namespace rolvane {

namespace {

bool isGroupChange(const CXDChangeRecord& record) {
    return record.group() && *record.group() != kPeopleGroup;
}

bool merges(CXDChangeRecord& record) {
    try {
        return record.canBeMerged();
    } catch (const CXException& e) {
        CXLog("Exception with reading change record: %@", e);
        CXLog("Change record: %@", record);
        return false;
    }
}

bool startsFold(CXDChangeRecord& record) {
    if (record.appliesToSources() == CXDSyncSourceCX || !isGroupChange(record)) return false;
    switch (record.type()) {
    case CXDCompositeGroupChange:
    case CXDChangeGroupReadACL:
    case CXDChangeGroupReadWriteACL:
    case CXDDeleteRecord:
    case CXDDeleteGroup: return false;
    default: return merges(record);
    }
}

CXDChangeRecords split(const CXDChangeRecords& records) {
    CXDChangeRecords work;
    work.reserve(records.size());
    for (const CXDChangeRecordPtr& record : records) {
        if (!isGroupChange(*record)) {
            work.push_back(record);
            continue;
        }
        for (CXDChangeRecordPtr& part : record->splitChangeRecord()) work.push_back(std::move(part));
    }
    return work;
}

CXDChangeRecordPtr compositeFor(const CXDChangeRecord& record) {
    auto composite = std::make_shared<CXDChangeRecord>(record.initialSource(), CXDCompositeGroupChange, record.user(),
                                                       std::nullopt, record.group());
    composite->setAppliesToSources(record.appliesToSources());
    return composite;
}

} // namespace

CXDChangeRecords flattenGroupChanges(const CXDChangeRecords& records) {
    CXDChangeRecords work = split(records);
    std::unordered_map<UniqueId, std::vector<size_t>> placesOfGroup; // ascending
    for (size_t i = 0; i < work.size(); ++i)
        if (isGroupChange(*work[i])) placesOfGroup[*work[i]->group()].push_back(i);

    CXDChangeRecords flat; // from the back to the front
    for (size_t i = work.size(); i-- > 0;) {
        const CXDChangeRecordPtr record = std::move(work[i]);
        work[i] = nullptr;
        if (!record) continue; // folded already
        if (!startsFold(*record)) {
            flat.push_back(record);
            continue;
        }
        const CXDChangeRecordPtr composite = compositeFor(*record);
        composite->mergeWithGroupChangeRecord(*record);
        std::vector<size_t>& places = placesOfGroup[*record->group()];
        std::vector<size_t> kept;
        for (; !places.empty(); places.pop_back()) {
            const size_t place = places.back();
            if (!work[place]) continue;
            if (!merges(*work[place])) {
                kept.push_back(place);
                continue;
            }
            composite->mergeWithGroupChangeRecord(*work[place]);
            work[place] = nullptr;
        }
        places.assign(kept.rbegin(), kept.rend());
        flat.push_back(composite);
    }
    std::reverse(flat.begin(), flat.end());
    return flat;
}

} // namespace rolvane
