#include "engine/UnsettledGroups.h"

#include "contacts/Identifier.h"

#include <unordered_map>

namespace rolvane {

Dictionary unsettledGroups(const CXDChangeRecords& records, size_t fresh) {
    struct Met {
        size_t times = 0;
        bool isGroup = false;
    };
    Dictionary unsettled;
    if (records.size() <= fresh) return unsettled; // nothing waited
    std::unordered_map<UniqueId, Met> met;
    for (size_t i = fresh; i < records.size(); ++i) {
        const CXDChangeRecord& record = *records[i];
        if (record.initialSource() != CXDSyncSourceCX) continue;
        if (record.group()) met[*record.group()].isGroup = true;
        if (record.person()) met[*record.person()];
    }
    if (met.empty()) return unsettled;
    const auto count = [&](const CXDChangeRecord& record, const std::optional<UniqueId>& identifier) {
        if (!identifier || record.initialSource() != CXDSyncSourceCX) return;
        if (const auto found = met.find(*identifier); found != met.end()) ++found->second.times;
    };
    for (const CXDChangeRecordPtr& record : records) {
        count(*record, record->group());
        if (record->person() != record->group()) count(*record, record->person());
    }
    for (const auto& [identifier, of] : met)
        if (of.isGroup || of.times > 1)
            unsettled.set(of.isGroup ? identifier.str() : std::string(kCXAllGroupUID), true);
    return unsettled;
}

} // namespace rolvane
