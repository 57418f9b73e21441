#include "daemon/CXDProgressManager.h"

namespace rolvane {

void CXDProgressManager::setEngine(const RecordLocator* locator, const LocationOwner* owner) {
    _locator = locator;
    _owner = owner;
}

void CXDProgressManager::startedPhase(int32_t phase) {
    bool first = false;
    {
        const std::lock_guard lock(_mutex);
        first = _currentPhase == 0;
        if (first) {
            _willProcessCounts.clear();
            _didProcessCounts.clear();
        }
        _currentPhase = phase;
    }
    if (first) _notifications.post({"CXDStartedSyncingNotification", std::nullopt, {}});
}

// A record without a remote location is counted nowhere.
void CXDProgressManager::willProcessChangeRecord(const CXDChangeRecordPtr& record) {
    const auto location = _locator ? record->remoteLocation(*_locator) : std::nullopt;
    if (!location) return;
    const std::lock_guard lock(_mutex);
    ++_willProcessCounts[*location];
}

void CXDProgressManager::didProcessChangeRecord(const CXDChangeRecordPtr& record) {
    const auto location = _locator ? record->remoteLocation(*_locator) : std::nullopt;
    if (!location) return;
    int64_t will = 0, did = 0;
    {
        const std::lock_guard lock(_mutex);
        const auto announced = _willProcessCounts.find(*location);
        will = announced == _willProcessCounts.end() ? 0 : announced->second;
        did = ++_didProcessCounts[*location];
    }
    if (will == 0) return;
    const bool own = _owner && _owner->userForRemoteLocation(*location) == kSelf;
    const std::string shown = own ? "local" : location->str();
    _notifications.post(
        {"CXDSyncProgressNotification",
         std::nullopt,
         {{"progress", static_cast<double>(did) / static_cast<double>(will)}, {"remoteLocation", shown}}});
}

void CXDProgressManager::stop() {
    _notifications.post({"CXDStoppedSyncingNotification", std::nullopt, {}});
}

int32_t CXDProgressManager::currentPhase() const {
    const std::lock_guard lock(_mutex);
    return _currentPhase;
}

} // namespace rolvane
