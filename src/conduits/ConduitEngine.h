#pragma once

#include "acl/CXACLManager.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"
#include "model/Refusal.h"
#include "model/TreeLook.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXDConduit;

// What a conduit asks of the engine that owns it. CXDSyncEngine implements it; tests implement it small.
class ConduitEngine : public LocationOwner {
public:
    // The mutable dictionary under the key inside the conduit's data, made empty at either level when absent.
    virtual Dictionary conduitObjectForKey(const std::string& conduitID, const std::string& key) = 0;
    virtual void setConduitObjectForKey(const std::string& conduitID, const Value& object, const std::string& key) = 0;
    // The number of the state that all of that is in: an equal one says that nothing has changed since, but for the
    // dates of trees. None where nobody keeps count. Main thread.
    virtual std::optional<uint64_t> stateGeneration() { return std::nullopt; }
    virtual void syncPrefs() = 0;
    // Saves the contact database while more changes of the pass are to come, together with what the engine remembers of
    // those before: when the change that is being applied is done. Main thread.
    virtual void saveInThePass() = 0;

    virtual bool isRevoked(const RemoteLocation& location) const = 0;
    virtual std::vector<RemoteLocation> revokedRemoteLocations() const = 0;
    virtual void revokeRemoteLocation(const RemoteLocation& location, const std::optional<UniqueId>& subscription) = 0;
    virtual void setRemoteLocationForSubscriptionUID(const std::optional<RemoteLocation>& location,
                                                     const std::optional<UniqueId>& subscription) = 0;
    virtual std::optional<RemoteLocation> remoteLocationForSubscriptionUID(const UniqueId& subscription) const = 0;

    virtual bool shouldChangeRecordBeCanceled(const CXDChangeRecord& record) const = 0; // any thread
    // The person is to be told. Any thread.
    virtual void noteRefused(const Refusal& /*refusal*/) {}
    // For the outcome of the pass. Main thread.
    virtual void storeWasTested(bool /*reached*/, int /*error: kCXDAVError…*/, const std::string& /*reason*/) {}
    virtual void treeWasLookedAt(const UserName& /*user*/, TreeLook /*how*/) {}
    virtual bool lockURL(const Url& url) = 0; // any thread
    virtual int32_t sourcesForGUID(const UniqueId& group) = 0;
    virtual CXDConduit* conduitForSyncSource(int32_t source) = 0; // none when no conduit serves it

    // What the source is known to hold of a user's group: a copy, empty when nothing is known. Any thread.
    virtual Dictionary knownGroupState(const std::string& /*conduitID*/, const UserName& /*user*/,
                                       const UniqueId& /*group*/) {
        return {};
    }
    // Whether changes of the user's wait for the source, in the stored queue or because it has refused them. Reads the
    // whole queue.
    virtual bool hasPendingChanges(const UserName& /*user*/, int32_t /*source*/) { return false; }

    virtual void updateStateAndExitIfNeeded() = 0;
    virtual void checkCXShareCount() = 0;
    virtual void applyChangeRecords(const CXDChangeRecords& records) = 0; // a trickle pass
    virtual void bringSourcesUpToDate() = 0;
    virtual void cancel() = 0; // stops progress and ends the process
};

} // namespace rolvane
