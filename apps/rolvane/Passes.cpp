#include "Passes.h"

#include "Counted.h"
#include "Publication.h"

#include "daemon/DaemonControl.h"
#include "engine/EngineState.h"
#include "store/CXDAVManager.h"

#include <chrono>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

constexpr const char* kDaemonProgram = "RolvaneManager";
constexpr const char* kMakePass = "SimulateVaultraNotification";

// A daemon that ends in the middle would be waited for in vain.
void requireDaemon(const DaemonControl& daemon) {
    if (daemon.running()) return;
    throw CommandError(kFailed, fmt::format("RolvaneManager ended before the pass was done. What is left is kept; "
                                            "`rolvane sync` goes on with it. Its log is {}.",
                                            DaemonControl::logPath()));
}

} // namespace

Url ownBase() {
    const auto account = CXDAVAccount::load(); // says what is wrong with one that cannot be used
    try {
        if (account) (void)account->password();
    } catch (const CXException& error) {
        throw CommandError(kRefused, error.reason());
    }
    const std::string user = CXDAVManager::vaultraUser();
    if (user.empty())
        throw CommandError(kFailed, "There is no account on a store yet. `rolvane account set` makes one.");
    return CXDAVManager::ostrelBaseLocationForOstrelUser(UserName(user));
}

int64_t pendingChanges() {
    return static_cast<int64_t>(EngineState(Preferences::shared()).getPendingChanges().size());
}

void reportPending(Context& context) {
    const int64_t waiting = pendingChanges();
    if (waiting == 0) return;
    CXDAVError error;
    const bool reachable = CXDAVManager::canReachOstrelError(error);
    context.warn(fmt::format("{}: {}", counted(waiting, "change waits", "changes wait"),
                             reachable ? "the store did not take them yet. They are tried again in the next pass."
                                       : error.reason + " They are sent when the store can be reached again."));
    context.exitCode = reachable ? kFailed : error.code == kCXDAVErrorAuthentication ? kRefused : kUnreachable;
}

void waitForPass(Context& context, PassWatch& watch, const std::string& label, int64_t position, Date saved,
                 double seconds) {
    ProgressBar bar(context, label);
    watch.onEvent = [&](const PassWatch::Event& event) {
        if (event.kind == PassWatch::Event::Kind::progress) bar.update(event.fraction);
    };
    CXRolvane& database = context.database();
    const DaemonControl daemon;
    const auto start = std::chrono::steady_clock::now();
    bool asked = false;
    const auto passed = [&] {
        const auto lastPass = Preferences::shared().get(kDaemonDomain, kCXDCXConduitLastSyncDate).date();
        return lastPass && *lastPass > saved && database.cursorPosition(kDaemonProgram) >= position;
    };
    const auto done = watch.waitUntil(
        [&] {
            if (passed()) return true;
            requireDaemon(daemon);
            // The daemon made no pass of the change, as of one that leads to nothing, or did not hear of it.
            constexpr std::chrono::seconds kSilence(2);
            if (!asked && !watch.atWork() && std::chrono::steady_clock::now() - start > kSilence)
                asked = watch.tell(kMakePass).has_value();
            return false;
        },
        seconds);
    watch.onEvent = nullptr;
    if (!done)
        throw CommandError(kUnreachable, fmt::format("The daemon had not finished after {} seconds; it goes on by "
                                                     "itself. `rolvane watch` shows how far it is.",
                                                     seconds));
}

void makePass(Context& context, double seconds) {
    const DaemonControl daemon;
    if (!daemon.running()) {
        daemon.runOnce(seconds);
        return;
    }
    PassWatch watch(context, !context.quiet);
    ProgressBar bar(context, "Synchronising");
    int stoppedBefore = -1;
    bool asked = false; // what was heard before belongs to another pass
    watch.onEvent = [&](const PassWatch::Event& event) {
        if (event.kind == PassWatch::Event::Kind::progress) bar.update(event.fraction);
        if (asked && event.kind == PassWatch::Event::Kind::started && stoppedBefore < 0)
            stoppedBefore = watch.stopped();
    };
    asked = true;
    const auto served = watch.tell(kMakePass);
    if (served && !*served) { // there was nothing to serve when it started
        daemon.stop();
        daemon.runOnce(seconds);
        daemon.start();
        return;
    }
    const auto passed = [&] { return stoppedBefore >= 0 && watch.stopped() > stoppedBefore; };
    const bool inVain = !watch.waitUntil([&] { return passed() || !daemon.running(); }, seconds);
    watch.onEvent = nullptr;
    // It was just ending, because nothing is shared any more for instance.
    if (!inVain && !passed()) return daemon.runOnce(seconds);
    if (inVain)
        throw CommandError(kUnreachable, fmt::format("No pass ended within {} seconds. `rolvane daemon status` tells "
                                                     "whether the daemon is at work.",
                                                     seconds));
}

void sync(Context& context, double seconds) {
    Publication publication(context.database());
    bool subscribed = false;
    for (const CXSubscriptionRef& s : context.database().subscriptions()) subscribed = subscribed || !s->isLocal();
    if (!publication.anything() && !subscribed) {
        context.say("Nothing is published and nobody is subscribed to: there is nothing to bring up to date.");
        return;
    }
    makePass(context, seconds);
    // A record that met a lock of its tree waits for the next pass, and so may a connection that a restart has cut.
    CXDAVError error;
    if (pendingChanges() > 0 && CXDAVManager::canReachOstrelError(error)) makePass(context, seconds);
    reportPending(context);
    if (context.exitCode == kOk) context.say("Everything is up to date.");
}

} // namespace rolvane::cli
