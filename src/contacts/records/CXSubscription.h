#pragma once

#include "contacts/records/CXRecord.h"

namespace rolvane {

class CXSubscription;
using CXSubscriptionRef = std::shared_ptr<CXSubscription>;

// A subscription to a remote location. Every database holds one built-in subscription whose location is "local"
// (`_isAll` false): its owner's own data. It cannot be removed; asking is logged and changes nothing.
class CXSubscription : public CXRecord {
public:
    // In no database yet. Adding it to one also makes the location's all-contacts group.
    static CXSubscriptionRef create(const RemoteLocation& location, bool isAll = true, std::string_view name = {});
    // In the process's shared database; null when there is none.
    static CXSubscriptionRef findSubscriptionWithRemoteLocation(const RemoteLocation& location);

    RemoteLocation remoteLocation() const; // hides CXRecord's: a subscription's own location
    bool _isAll() const;                   // to a whole published database
    std::string name() const;              // "" when it has none
    bool isLocal() const;

protected:
    using CXRecord::CXRecord;
    friend class CXRolvane;
};

} // namespace rolvane
