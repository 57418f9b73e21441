#pragma once

#include "acl/CXACLManager.h"
#include "engine/EngineCollaborators.h"
#include "foundation/Mutex.h"
#include "foundation/Notification.h"
#include "model/CXDChangeRecord.h"

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <tuple>

namespace rolvane {

// Tells other processes that the daemon is at work and how far each shared location has got: counts, per remote
// location, the records that a pass will process and those that it has processed, and broadcasts three notifications.
// The counts go on over all passes of the process. Any thread.
class CXDProgressManager : public ProgressReporter {
public:
    // All three are borrowed and outlive the manager. The locator and the owner may be given later, before the first
    // record: the engine that answers for them is made with this manager.
    explicit CXDProgressManager(DistributedNotifications& notifications) : _notifications(notifications) {}
    void setEngine(const RecordLocator* locator, const LocationOwner* owner);

    void startedPhase(int32_t phase) override;
    void willProcessChangeRecord(const CXDChangeRecordPtr& record) override;
    void didProcessChangeRecord(const CXDChangeRecordPtr& record) override;
    void stop() override;

    int32_t currentPhase() const;

private:
    // Where records of the same sources and user live, and what progress there is called: asked for once a phase,
    // because a pass has many records of few places.
    using Origin = std::tuple<int32_t, int32_t, std::optional<UserName>>; // initial source, applies-to mask, user
    struct Place {
        std::optional<RemoteLocation> location;
        std::optional<std::string> shown;
    };
    Place& placeOf(const CXDChangeRecord& record) REQUIRES(_mutex);

    DistributedNotifications& _notifications;
    const RecordLocator* _locator = nullptr;
    const LocationOwner* _owner = nullptr;
    mutable Mutex _mutex;
    int32_t _currentPhase GUARDED_BY(_mutex) = 0;
    std::map<Origin, Place> _places GUARDED_BY(_mutex);
    std::map<RemoteLocation, int64_t> _willProcessCounts GUARDED_BY(_mutex);
    std::map<RemoteLocation, int64_t> _didProcessCounts GUARDED_BY(_mutex);
};

} // namespace rolvane
