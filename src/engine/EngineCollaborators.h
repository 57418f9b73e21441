#pragma once

#include "engine/pass/PassOutcome.h"
#include "foundation/Date.h"
#include "foundation/Notification.h"
#include "foundation/Preferences.h"
#include "foundation/RunLoop.h"
#include "foundation/StrongString.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"
#include "store/locks/CXWebDAVLock.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class CXDConduit;
class CXRolvane;
class ConduitEngine;
class IdleExit;
class InterruptibleSleep;

// Who is told how far a pass has got. Exists so that tests can replace it. `didProcessChangeRecord` comes from the
// workers too; everything else from the main thread, but `stop` also from a thread that ends the process.
class ProgressReporter {
public:
    virtual ~ProgressReporter() = default;
    virtual void startedPhase(int32_t phase) = 0; // 1 gathering, 2 pass started, 3 applying
    virtual void willProcessChangeRecord(const CXDChangeRecordPtr& record) = 0;
    virtual void didProcessChangeRecord(const CXDChangeRecordPtr& record) = 0;
    virtual void stop() = 0;
};

// Ends the process. Exists so that tests can replace it, by throwing something that is no CXException: nothing may run
// after it. Called on the main thread, and on the thread that could not get the password.
class ProcessEnd {
public:
    virtual ~ProcessEnd() = default;
    [[noreturn]] virtual void end(int status) = 0;
};

// The network store's account and configuration as the engine needs them. Exists so that tests can replace it.
class NetworkAccount {
public:
    virtual ~NetworkAccount() = default;
    virtual std::optional<UserName> vaultraUser() const = 0; // nothing without an account
    virtual Value configValueForKey(const std::string& key, Value defaultValue) const = 0;
    virtual void updateConfigDataIfNeeded() = 0;
    // One a process; an empty function takes it away.
    virtual void setFailedPasswordHandler(std::function<void()> handler) = 0;
};
// CXDAVManager's and CXFileManager's.
std::unique_ptr<NetworkAccount> makeStoreNetworkAccount();

// The conduits that a pass drives, made once by the engine.
struct EngineConduits {
    std::unique_ptr<CXDConduit> cx;
    std::unique_ptr<CXDConduit> vaultra;
    std::function<bool()> vaultraOffLine; // the store cannot be reached now; empty: it always can
};
using ConduitFactory = std::function<EngineConduits(ConduitEngine& engine)>;

// Everything that the engine touches. All of it is borrowed and outlives the engine.
struct EngineCollaborators {
    CXRolvane& rolvane;
    Preferences& preferences;
    DistributedNotifications& distributed;
    RunLoop& runLoop; // the main thread's
    const Clock& clock;
    ProgressReporter& progress;
    ProcessEnd& processEnd;
    NetworkAccount& account;
    IdleExit& idleExit;
    LockFactory makeLock;
    ConduitFactory makeConduits;
    std::string loginName;
    std::shared_ptr<InterruptibleSleep> renewalSleep; // none: the steady clock's
    // Gives back locks on the store that killed runs of this program hold; at each gathering, while the store is there.
    std::function<void()> releaseLocksOfEndedRuns = {};
    // The requests to the store that have failed since it was asked last, in order.
    std::function<std::vector<PassFailure>()> takeFailures = {};
    // At the very end of every pass, on the main thread, when its outcome is stored and broadcast. May start no pass
    // itself; it may ask the run loop for one.
    std::function<void(const PassOutcome& outcome)> passEnded = {};
};

} // namespace rolvane
