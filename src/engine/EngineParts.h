#pragma once

#include "conduits/CXDConduit.h"
#include "engine/EngineCollaborators.h"
#include "engine/memory/EngineState.h"
#include "engine/pass/OutcomeKeeper.h"
#include "engine/pass/RemoteLocks.h"
#include "engine/pass/Revocation.h"
#include "engine/queue/DeniedChanges.h"

#include <atomic>
#include <thread>

namespace rolvane {

// What the engine's subjects share. Owned by CXDSyncEngine; lives as long as it does.
//
// Locks, each taken alone: RemoteLocks' list, OutOfOrderWork's two, and the leaves of DeniedChanges, Revocation and
// EngineState. The conduit data's lock is also taken under OutOfOrderWork's lock of processed changes.
struct EngineParts {
    explicit EngineParts(const EngineCollaborators& collaborators);

    EngineCollaborators with;
    EngineState state;
    DeniedChanges denied;
    Revocation revoked;
    RemoteLocks locks;
    OutcomeKeeper outcomes;
    EngineConduits conduits;
    std::atomic<bool> terminating{false}; // passes wind down: what is not applied yet stays pending
    mutable bool ending = false;          // killCXD has begun; main thread
    bool retryScheduled = false;          // a retry pass waits on the run loop; main thread
    int passesAskedFor = 0;               // those that wait for the end of the one that runs; main thread
    bool saveInThePass = false;           // a conduit asks for it; main thread
    Dictionary marksOfThePass;            // as they were before the scan took them; main thread
    const std::thread::id mainThread = std::this_thread::get_id();

    bool vaultraOffLine() const { return conduits.vaultraOffLine && conduits.vaultraOffLine(); }
};

// Puts down and broadcasts how the pass has ended. Nothing when none runs. Any thread that may end the process.
void endPass(EngineParts& parts);

// Ends the process, and the pass when one runs: progress stops, the run loop turns once so that what is queued goes
// out, exit status 0. From another thread than the main one the run loop is left alone.
[[noreturn]] void killCXD(EngineParts& parts);

// The memory counts for this database and account from now on. A first pass says so long before it ends: killed behind
// its first save, it would be a first pass again, for which no contact here came from a store.
void claimState(EngineParts& parts);
// checkCXShareCount: forgets everything when the database is not the one of the last pass, or the account is another.
void checkCXShareCount(EngineParts& parts);
// updateStateAndExitIfNeeded: without an account no remote subscription and no publication are left; with nothing
// published and fewer than two subscriptions the process ends.
void updateStateAndExitIfNeeded(EngineParts& parts);
// A subscription that ended and was made anew between two looks has a new identifier. What is remembered of its
// location belongs to the former one, whose copies are gone: compared with it, their absence would be carried to the
// publisher's store as removals. It is forgotten, and everything comes again.
void forgetFormerSubscriptions(EngineParts& parts);
// removeCacheDataForConduit:. Forgets users of the conduit to whom there is no subscription any more.
void removeCacheDataForConduit(EngineParts& parts, CXDConduit& conduit);

} // namespace rolvane
