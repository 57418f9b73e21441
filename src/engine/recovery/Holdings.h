#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/queue/ChangeQueue.h"

#include <unordered_map>
#include <unordered_set>

namespace rolvane {

// The all-contacts group's list of locations is there and empty while only single groups are published.
inline bool isPublished(const CXGroup& group) {
    const auto locations = group.multiValueForProperty(kCXRemoteLocationProperty);
    return locations && !locations->empty();
}

// What the database still holds, under the own table or that of the subscribed copies; each identifier is asked for
// once. What it does not hold is withdrawn from the store, so a damaged database throws CXDamagedDatabase.
//
// A group of a store whose creation waits in the queue has never been here, and is not gone. (One that was gathered
// just now may be the own write of a killed pass.)
class Holdings {
public:
    // `records`: `fresh` new ones and then the queue.
    Holdings(CXRolvane& rolvane, const CXDChangeRecords& records, size_t fresh);
    bool person(const UniqueId& uid) { return holds(uid, kCXPersonTable, kCXSubscribedPersonTable); }
    bool group(const UniqueId& uid) {
        return uid.str() == kCXAllGroupUID || uid == kPeopleGroup ||
               _toCome.contains(cxUIDWithTableName(uid, kCXGroupTable)) ||
               holds(uid, kCXGroupTable, kCXSubscribedGroupTable);
    }

private:
    bool holds(const UniqueId& uid, std::string_view table, std::string_view tableOfCopies) {
        const auto [known, isNew] = _known.try_emplace(uid);
        if (!isNew) return known->second;
        const UniqueId own = cxUIDWithTableName(uid, table), copy = cxUIDWithTableName(uid, tableOfCopies);
        known->second = _rolvane.recordForUniqueId(own) || _rolvane.recordForUniqueId(copy);
        if (!known->second)
            for (const UniqueId& form : {own, copy}) _absences.requireGone(form);
        return known->second;
    }
    CXRolvane& _rolvane;
    AbsenceCheck _absences;
    std::unordered_map<UniqueId, bool> _known;
    std::unordered_set<UniqueId> _toCome;
};

} // namespace rolvane
