#include "daemon/CXDProgressManager.h"

#include "foundation/Mutex.h"
#include "foundation/SignOfLife.h"

namespace rolvane {

void CXDProgressManager::setEngine(const RecordLocator* locator, const LocationOwner* owner) {
    const Lock lock(_mutex);
    _locator = locator;
    _owner = owner;
    _places.clear();
}

void CXDProgressManager::startedPhase(int32_t phase) {
    bool first = false;
    {
        const Lock lock(_mutex);
        first = _currentPhase == 0;
        if (first) {
            _willProcessCounts.clear();
            _didProcessCounts.clear();
        }
        _currentPhase = phase;
        _places.clear();
    }
    if (first) _notifications.post({"CXDStartedSyncingNotification", std::nullopt, {}});
}

CXDProgressManager::Place& CXDProgressManager::placeOf(const CXDChangeRecord& record) {
    const auto [found, isNew] = _places.try_emplace({record.initialSource(), record.appliesToSources(), record.user()});
    if (isNew && _locator) found->second.location = record.remoteLocation(*_locator);
    return found->second;
}

// A record without a remote location is counted nowhere.
void CXDProgressManager::willProcessChangeRecord(const CXDChangeRecordPtr& record) {
    const Lock lock(_mutex);
    if (const auto& location = placeOf(*record).location) ++_willProcessCounts[*location];
}

void CXDProgressManager::didProcessChangeRecord(const CXDChangeRecordPtr& record) {
    signOfLife();
    std::string shown;
    double progress = 0;
    {
        const Lock lock(_mutex);
        Place& place = placeOf(*record);
        if (!place.location) return;
        const auto announced = _willProcessCounts.find(*place.location);
        const int64_t will = announced == _willProcessCounts.end() ? 0 : announced->second;
        const int64_t did = ++_didProcessCounts[*place.location];
        if (will == 0) return;
        progress = static_cast<double>(did) / static_cast<double>(will);
        if (!place.shown) {
            const bool own = _owner && _owner->userForRemoteLocation(*place.location) == kSelf;
            place.shown = own ? "local" : place.location->str();
        }
        shown = *place.shown;
    }
    _notifications.post(
        {"CXDSyncProgressNotification", std::nullopt, {{"progress", progress}, {"remoteLocation", shown}}});
}

void CXDProgressManager::stop() {
    _notifications.post({"CXDStoppedSyncingNotification", std::nullopt, {}});
}

int32_t CXDProgressManager::currentPhase() const {
    const Lock lock(_mutex);
    return _currentPhase;
}

} // namespace rolvane
