#pragma once

#include "foundation/Mutex.h"
#include "foundation/StrongString.h"

#include <optional>
#include <unordered_set>
#include <vector>

namespace rolvane {

class EngineState;

// The remote locations whose subscriptions were revoked in the current pass. Asked by the workers for every record;
// written on the main thread. Its lock is a leaf.
class Revocation {
public:
    // revokeRemoteLocation:subscriptionUID:. Forgets what both conduits know about the user of the location, the
    // subscription, and the user's queued changes. The conduit data is written by the pass that follows.
    void revoke(EngineState& state, const RemoteLocation& location, const UserName& user,
                const std::optional<UniqueId>& subscription);
    bool contains(const RemoteLocation& location) const;
    std::vector<RemoteLocation> all() const; // in order of revocation, repeated ones included
    void clear();

private:
    mutable Mutex _lock;
    std::vector<RemoteLocation> _locations GUARDED_BY(_lock);
    std::unordered_set<RemoteLocation> _known GUARDED_BY(_lock);
};

} // namespace rolvane
