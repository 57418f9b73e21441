#include "engine/GoneThings.h"

#include "engine/Holdings.h"

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

} // namespace

void withdrawWhatIsGone(CXDChangeRecords& records, size_t fresh, CXRolvane& rolvane) {
    Holdings holdings(rolvane);
    for (size_t i = fresh; i < records.size(); ++i) {
        const CXDChangeRecord& record = *records[i];
        if (record.initialSource() != CXDSyncSourceCX || !record.changeMadeByDataOwner()) continue;
        if (record.type() == CXDUpdateRecord && record.person() && !holdings.person(*record.person()))
            records[i] = removal(record, CXDDeleteRecord, record.person(), std::nullopt);
        else if (putsGroupThere(record) && !holdings.group(*record.group()))
            records[i] = removal(record, CXDDeleteGroup, std::nullopt, record.group());
    }
}

} // namespace rolvane
