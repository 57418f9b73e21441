#pragma once

#include "contacts/CXRolvane.h"
#include "contacts/Constants.h"
#include "contacts/Identifier.h"
#include "engine/ChangeQueue.h"

#include <unordered_map>

namespace rolvane {

// The all-contacts group's list of locations is there and empty while only single groups are published.
inline bool isPublished(const CXGroup& group) {
    const auto locations = group.multiValueForProperty(kCXRemoteLocationProperty);
    return locations && !locations->empty();
}

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

} // namespace rolvane
