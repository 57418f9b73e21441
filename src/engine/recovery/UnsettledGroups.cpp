#include "engine/recovery/UnsettledGroups.h"

#include "contacts/records/Identifier.h"

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
    const auto note = [&](const std::optional<UniqueId>& identifier, bool waited, bool isGroup) {
        if (!identifier) return;
        const auto found = waited ? met.try_emplace(*identifier).first : met.find(*identifier);
        if (found == met.end()) return;
        ++found->second.times;
        found->second.isGroup |= waited && isGroup;
    };
    for (size_t i = records.size(); i-- > 0;) { // from the end: of the new ones only what meets one that waited counts
        const CXDChangeRecord& record = *records[i];
        if (record.initialSource() != CXDSyncSourceCX) continue;
        note(record.group(), i >= fresh, true);
        if (record.person() != record.group()) note(record.person(), i >= fresh, false);
    }
    for (const auto& [identifier, of] : met)
        if (of.isGroup || of.times > 1)
            unsettled.set(of.isGroup ? identifier.str() : std::string(kCXAllGroupUID), true);
    return unsettled;
}

} // namespace rolvane
