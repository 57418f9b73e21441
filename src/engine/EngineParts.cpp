#include "engine/EngineParts.h"

#include "contacts/database/CXRolvane.h"
#include "engine/queue/RefusedChanges.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <cstdlib>
#include <utility>

namespace rolvane {

namespace {

std::unique_ptr<InterruptibleSleep> sleepOf(const EngineCollaborators& collaborators) {
    if (!collaborators.renewalSleep) return makeInterruptibleSleep();
    // The engine's handle on a sleep that the test keeps.
    class Borrowed : public InterruptibleSleep {
    public:
        explicit Borrowed(std::shared_ptr<InterruptibleSleep> sleep) : _sleep(std::move(sleep)) {}
        bool sleep(double seconds) override { return _sleep->sleep(seconds); }
        void interrupt() override { _sleep->interrupt(); }

    private:
        std::shared_ptr<InterruptibleSleep> _sleep;
    };
    return std::make_unique<Borrowed>(collaborators.renewalSleep);
}

// A single value that is missing, or a user without a name.
bool isEmpty(const std::optional<UserName>& user) {
    return !user || user->empty();
}

// What is shared over the network store, the own first. Nothing from another thread: the main one may be at work.
std::optional<std::vector<PassFacts::Shared>> shared(const EngineParts& parts) {
    const auto own = parts.with.account.vaultraUser();
    if (std::this_thread::get_id() != parts.mainThread || isEmpty(own) || !parts.conduits.vaultra) return std::nullopt;
    const Dictionary unsaved = parts.with.preferences.get(kDaemonDomain, kCXDUnsavedAccessLists).dictionary();
    std::vector<PassFacts::Shared> all;
    const auto add = [&](const UserName& user) {
        const CXDConduit& network = *parts.conduits.vaultra;
        const auto base = network.baseLocationForUser(network.realUserFromUser(user));
        const std::string location = base ? base->absoluteString() : std::string();
        all.push_back({user, location, unsaved.contains(location)});
    };
    if (parts.with.rolvane.allGroup()->valueForProperty(kCXRemoteLocationProperty)) add(kSelf);
    for (const CXSubscriptionRef& subscription : parts.with.rolvane.subscriptions()) {
        const RemoteLocation location = subscription->remoteLocation();
        if (syncSourceForRemoteLocation(location) != CXDSyncSourceVaultra) continue;
        const auto user = userForRemoteLocation(location, own, parts.with.loginName);
        if (user && !user->empty() && user != kSelf) add(*user);
    }
    return all;
}

} // namespace

EngineParts::EngineParts(const EngineCollaborators& collaborators)
    : with(collaborators), state(collaborators.preferences),
      locks(collaborators.makeLock, collaborators.clock, sleepOf(collaborators)),
      outcomes(collaborators.preferences, collaborators.clock,
               {[this] { return shared(*this); }, collaborators.takeFailures,
                [this] { return retryScheduled || passesAskedFor > 0; }}) {}

void endPass(EngineParts& parts) {
    if (!parts.outcomes.running()) return;
    const PassOutcome outcome = parts.outcomes.end();
    parts.with.distributed.post({kCXDPassEndedNotification, std::nullopt, encodeOutcome(outcome).dictionary()});
    if (parts.with.passEnded && std::this_thread::get_id() == parts.mainThread) parts.with.passEnded(outcome);
}

void killCXD(EngineParts& parts) {
    if (parts.outcomes.running()) parts.outcomes.caught("RolvaneManager ended before the pass did.");
    endPass(parts);
    parts.with.progress.stop();
    if (std::this_thread::get_id() == parts.mainThread) {
        parts.ending = true; // whatever arrives in that turn starts no pass
        try {
            parts.with.runLoop.runOnce(0);
        } catch (const CXException& e) { // what could not be taken any more waits for the next process
            CXDLog("Left for the next run: %@", e);
        }
    }
    CXDLog("Killing RolvaneManager");
    parts.with.processEnd.end(0);
    std::abort(); // an end that returns is no end
}

void claimState(EngineParts& parts) {
    parts.state.claim(parts.with.rolvane.shareCount(), parts.with.account.vaultraUser());
}

void checkCXShareCount(EngineParts& parts) {
    Preferences& preferences = parts.with.preferences;
    const Value count = preferences.get(kDaemonDomain, kCXDShareCount);
    if (!count) {
        CXDLog("First Sync");
    } else if (count.integer() != parts.with.rolvane.shareCount()) {
        parts.state.reset();
        return;
    }
    const std::optional<std::string> last = preferences.get(kDaemonDomain, kCXDLastOstrelUser).optionalString();
    const std::optional<UserName> user = parts.with.account.vaultraUser();
    if (!user || !last || user->str() != *last) parts.state.reset();
}

void updateStateAndExitIfNeeded(EngineParts& parts) {
    CXRolvane& rolvane = parts.with.rolvane;
    size_t subscriptions = 0;
    bool save = false;
    const CXAllGroupRef allGroup = rolvane.allGroup();
    if (isEmpty(parts.with.account.vaultraUser())) {
        for (const CXSubscriptionRef& subscription : rolvane.subscriptions())
            if (!subscription->isLocal()) rolvane.removeRecord(subscription);
        allGroup->removeValueForProperty(kCXRemoteLocationProperty);
        save = true;
    } else {
        subscriptions = rolvane.subscriptions().size();
    }

    const bool publishes = static_cast<bool>(allGroup->valueForProperty(kCXRemoteLocationProperty));
    if (!publishes) {
        parts.state.conduitObjectForKey(kConduitCX, kPriorState).remove(kSelf.str());
        parts.state.conduitObjectForKey(kConduitVaultra, kPriorState).remove(kSelf.str());
        parts.state.withConduitData([](Dictionary& data) { forgetRefusedChanges(data); });
        parts.state.syncPrefs();
    }
    removeCacheDataForConduit(parts, *parts.conduits.vaultra);
    forgetFormerSubscriptions(parts);
    if (save) rolvane.save();
    // Two, not one: an owner who publishes nothing and has one subscription (the built-in one) is not served.
    if (publishes || subscriptions >= 2) return;
    endPass(parts);
    killCXD(parts);
}

void forgetFormerSubscriptions(EngineParts& parts) {
    for (const CXSubscriptionRef& subscription : parts.with.rolvane.subscriptions()) {
        const RemoteLocation location = subscription->remoteLocation();
        if (!parts.state.isOfFormerSubscription(location, subscription->uniqueId())) continue;
        const auto user = userForRemoteLocation(location, parts.with.account.vaultraUser(), parts.with.loginName);
        if (!user || user == kSelf) continue;
        CXDLog("Forgetting what came by a former subscription to %@", location);
        parts.state.forgetUser(*user);
        parts.state.removeSubscriptionMapForRemoteLocation(location);
        parts.state.syncPrefs();
    }
}

void removeCacheDataForConduit(EngineParts& parts, CXDConduit& conduit) {
    const std::string id = conduit.conduitID().value_or("");
    Dictionary users = parts.state.conduitObjectForKey(id, kPriorState);
    bool removed = false;
    for (const std::string& user : users.allKeys()) {
        if (user == kSelf.str()) continue;
        const std::optional<Url> base = conduit.baseLocationForUser(UserName(user));
        const RemoteLocation location(base ? base->absoluteString() : std::string());
        if (base && parts.with.rolvane.findSubscriptionWithRemoteLocation(location)) continue;
        CXDLog("Removing truth data for %@ (%@)", user, id);
        parts.state.conduitObjectForKey(kConduitCX, kPriorState).remove(user);
        parts.state.conduitObjectForKey(kConduitVaultra, kPriorState).remove(user);
        if (base) parts.state.removeSubscriptionMapForRemoteLocation(location);
        removed = true;
    }
    if (removed) parts.state.syncPrefs();
}

} // namespace rolvane
