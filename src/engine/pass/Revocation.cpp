#include "engine/pass/Revocation.h"

#include "engine/memory/EngineState.h"
#include "foundation/Mutex.h"

namespace rolvane {

void Revocation::revoke(EngineState& state, const RemoteLocation& location, const UserName& user,
                        const std::optional<UniqueId>& subscription) {
    {
        const Lock guard(_lock);
        _locations.push_back(location);
        _known.insert(location);
    }
    state.forgetUser(user);
    if (subscription) state.removeSubscription(*subscription);
}

bool Revocation::contains(const RemoteLocation& location) const {
    const Lock guard(_lock);
    return _known.count(location) != 0;
}

std::vector<RemoteLocation> Revocation::all() const {
    const Lock guard(_lock);
    return _locations;
}

void Revocation::clear() {
    const Lock guard(_lock);
    _locations.clear();
    _known.clear();
}

} // namespace rolvane
