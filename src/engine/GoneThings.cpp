#include "engine/GoneThings.h"

#include "contacts/CXRolvane.h"
#include "contacts/Identifier.h"
#include "engine/ChangeQueue.h"

#include <unordered_map>

namespace rolvane {

namespace {

// What the database still holds, under the own table or that of the subscribed copies; each identifier is asked for
// once.
class Holdings {
public:
    explicit Holdings(CXRolvane& rolvane) : _rolvane(rolvane) {}
    bool person(const UniqueId& uid) { return holds(uid, kCXPersonTable, kCXSubscribedPersonTable); }
    bool group(const UniqueId& uid) {
        return uid.str() == kCXAllGroupUID || uid == kPeopleGroup || holds(uid, kCXGroupTable, kCXSubscribedGroupTable);
    }

private:
    bool holds(const UniqueId& uid, std::string_view table, std::string_view tableOfCopies) {
        const auto [known, isNew] = _known.try_emplace(uid);
        if (isNew)
            known->second = _rolvane.recordForUniqueId(cxUIDWithTableName(uid, table)) ||
                            _rolvane.recordForUniqueId(cxUIDWithTableName(uid, tableOfCopies));
        return known->second;
    }
    CXRolvane& _rolvane;
    std::unordered_map<UniqueId, bool> _known;
};

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
