#include "Passes.h"

#include "FailureText.h"
#include "PassReport.h"
#include "Publication.h"
#include "Texts.h"

#include "daemon/DaemonControl.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <chrono>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

constexpr const char* kDaemonProgram = "RolvaneManager";
constexpr const char* kMakePass = "SimulateVaultraNotification";

[[noreturn]] void endedWithoutAWord() {
    throw CommandError(kFailed, tr("RolvaneManager ended before the pass was done. What is left is kept; "
                                   "`rolvane sync` goes on with it. Its log is {}.",
                                   DaemonControl::logPath()));
}

// The outcome of a pass of its own, or of one that a daemon made just before it ended.
PassOutcome outcomeOfOnce(PassWatch& watch, OutcomeWatch& outcomes, double seconds) {
    constexpr double kLastWords = 2; // a broadcast may still be on its way
    const DaemonControl daemon;
    if (!outcomes.latest()) daemon.runOnce(seconds);
    watch.waitUntil([&] { return outcomes.latest().has_value(); }, kLastWords);
    const auto outcome = outcomes.latest();
    if (!outcome) endedWithoutAWord();
    return *outcome;
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
    if (user.empty()) throw noAccount();
    return CXDAVManager::ostrelBaseLocationForOstrelUser(UserName(user));
}

PassOutcome waitForPass(Context& context, PassWatch& watch, OutcomeWatch& outcomes, const std::string& label,
                        int64_t position, double seconds) {
    ProgressBar bar(context, label);
    watch.onEvent = [&](const PassWatch::Event& event) {
        if (event.kind == PassWatch::Event::Kind::progress) bar.update(event.fraction);
    };
    CXRolvane& database = context.database();
    const DaemonControl daemon;
    const auto start = std::chrono::steady_clock::now();
    bool asked = false;
    std::optional<PassOutcome> outcome;
    const auto passed = [&] {
        outcome = outcomes.settled();
        // A pass that failed leaves the journal where it was.
        return outcome && (!isComplete(*outcome) || database.cursorPosition(kDaemonProgram) >= position);
    };
    const auto done = watch.waitUntil(
        [&] {
            if (passed()) return true;
            if (!daemon.running()) {
                if ((outcome = outcomes.latest())) return true; // it ended with its pass
                endedWithoutAWord();
            }
            // The daemon made no pass of the change, as of one that leads to nothing, or did not hear of it.
            constexpr std::chrono::seconds kSilence(2);
            if (!asked && !watch.atWork() && std::chrono::steady_clock::now() - start > kSilence)
                asked = watch.tell(kMakePass).has_value();
            return false;
        },
        seconds);
    watch.onEvent = nullptr;
    if (!done)
        throw CommandError(kUnreachable, tr("The daemon had not finished after {} seconds; it goes on by "
                                            "itself. `rolvane watch` shows how far it is.",
                                            seconds));
    return *outcome;
}

PassOutcome makePass(Context& context, double seconds) {
    const DaemonControl daemon;
    PassWatch watch(context, !context.quiet);
    OutcomeWatch outcomes(context);
    if (!daemon.running()) return outcomeOfOnce(watch, outcomes, seconds);
    ProgressBar bar(context, translated("Synchronising"));
    watch.onEvent = [&](const PassWatch::Event& event) {
        if (event.kind == PassWatch::Event::Kind::progress) bar.update(event.fraction);
    };
    const auto served = watch.tell(kMakePass);
    if (served && !*served) { // there was nothing to serve when it started
        daemon.stop();
        const PassOutcome outcome = outcomeOfOnce(watch, outcomes, seconds);
        daemon.start();
        return outcome;
    }
    std::optional<PassOutcome> outcome;
    const auto passed = [&] {
        outcome = outcomes.settled();
        return outcome && outcome->full;
    };
    const bool inTime = watch.waitUntil([&] { return passed() || !daemon.running(); }, seconds);
    watch.onEvent = nullptr;
    if (!inTime)
        throw CommandError(kUnreachable, tr("No pass ended within {} seconds. `rolvane daemon status` tells "
                                            "whether the daemon is at work.",
                                            seconds));
    if (passed()) return *outcome;
    return outcomeOfOnce(watch, outcomes, seconds); // it was just ending
}

bool mayGoBetter(const PassOutcome& outcome) {
    constexpr int kConflict = 412, kLocked = 423;
    if (!outcome.storeReached || !isComplete(outcome)) return false;
    return std::any_of(outcome.trees.begin(), outcome.trees.end(), [](const PassTree& tree) {
        if (tree.out.waiting == 0) return false;
        const int status = tree.out.why ? tree.out.why->status : 0;
        return status == 0 || status == kConflict || status == kLocked;
    });
}

void sync(Context& context, double seconds) {
    Publication publication(context.database());
    bool subscribed = false;
    for (const CXSubscriptionRef& s : context.database().subscriptions()) subscribed = subscribed || !s->isLocal();
    if (!publication.anything() && !subscribed) {
        context.say(
            translated("Nothing is published and nobody is subscribed to: there is nothing to bring up to date."));
        return;
    }
    (void)ownBase(); // an account that cannot be used is told in its own words
    PassOutcome outcome = makePass(context, seconds);
    if (mayGoBetter(outcome)) outcome = makePass(context, seconds);
    report(context, outcome, translated("Everything is up to date."));
    if (context.json) context.print(outcomeJson(outcome));
}

} // namespace rolvane::cli
