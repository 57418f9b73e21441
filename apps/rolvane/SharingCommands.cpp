#include "Context.h"
#include "Lookup.h"
#include "PassWatch.h"
#include "Publication.h"

#include "conduits/PublishedLayout.h"
#include "contacts/Constants.h"
#include "daemon/DaemonControl.h"
#include "engine/EngineState.h"
#include "foundation/PropertyList.h"
#include "store/CXDAVManager.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

constexpr double kPassSeconds = 3600; // a first publication over a slow line takes its time
constexpr const char* kDaemonProgram = "RolvaneManager";

// The owner's base location; refuses without a usable account.
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

// Reports the store as it is now; sets the exit code when changes are left waiting.
void reportResult(Context& context) {
    const int64_t waiting = pendingChanges();
    if (waiting == 0) return;
    CXDAVError error;
    const bool reachable = CXDAVManager::canReachOstrelError(error);
    context.warn(fmt::format("{} change{} wait{}: {}", waiting, waiting == 1 ? "" : "s", waiting == 1 ? "s" : "",
                             reachable ? "the store did not take them yet. They are tried again in the next pass."
                                       : error.reason + " They are sent when the store can be reached again."));
    context.exitCode = reachable ? kFailed : error.code == kCXDAVErrorAuthentication ? kRefused : kUnreachable;
}

// A daemon that ends in the middle would be waited for in vain.
void requireDaemon(const DaemonControl& daemon) {
    if (daemon.running()) return;
    throw CommandError(kFailed, fmt::format("RolvaneManager ended before the pass was done. What is left is kept; "
                                            "`rolvane sync` goes on with it. Its log is {}.",
                                            DaemonControl::logPath()));
}

// Draws the daemon's progress until what was saved at that position of the journal and that date has been through a
// pass: the daemon has taken the journal up to there, and a pass has ended since. (A daemon that watches a database for
// the first time takes the journal as read and scans the database instead; a pass that was under way when the change
// was saved ends without it.)
void waitForPass(Context& context, PassWatch& watch, int64_t position, Date saved, double seconds) {
    ProgressBar bar(context, "Publishing");
    watch.onEvent = [&](const PassWatch::Event& event) {
        if (event.kind == PassWatch::Event::Kind::progress) bar.update(event.fraction);
    };
    CXRolvane& database = context.database();
    const DaemonControl daemon;
    const auto passed = [&] {
        const auto lastPass = Preferences::shared().get(kDaemonDomain, kCXDCXConduitLastSyncDate).date();
        return lastPass && *lastPass > saved && database.cursorPosition(kDaemonProgram) >= position;
    };
    const auto done = watch.waitUntil(
        [&] {
            if (passed()) return true;
            requireDaemon(daemon);
            return false;
        },
        seconds);
    watch.onEvent = nullptr;
    if (!done)
        throw CommandError(kUnreachable, fmt::format("The daemon had not finished after {} seconds; it goes on by "
                                                     "itself. `rolvane watch` shows how far it is.",
                                                     seconds));
}

struct PublishOptions {
    std::string group;
    bool noWait = false, noDaemon = false, keep = false;
    double timeout = kPassSeconds;
};

void sync(Context& context, double seconds);

void publish(Context& context, const PublishOptions& options) {
    const Url base = ownBase();
    CXRolvane& database = context.database();
    Publication publication(database);
    const bool served = publication.anything();

    CXDAVError error;
    if (!CXDAVManager::canReachOstrelError(error) && error.code == kCXDAVErrorAuthentication)
        throw CommandError(kRefused, error.reason + " Nothing was published.");

    PassWatch watch(context);
    const CXGroupRef group = options.group.empty() ? nullptr : findGroup(database, options.group);
    const bool changed = group ? publication.publishGroup(group, base) : publication.publishEverything(base);
    database.save();
    const int64_t position = database.journalPosition();
    const Date saved = Clock::system().now();
    const std::string what = group ? fmt::format("The group \"{}\"", group->name()) : "The contact list";
    context.say(fmt::format("{} is published{} at {}.", what, changed ? "" : " already", base.absoluteString()));
    if (options.noDaemon) return;
    // A daemon that started with nothing shared serves nothing: it decides when it starts.
    const DaemonControl daemon;
    if (!served && daemon.running())
        daemon.restart();
    else
        daemon.start();
    if (options.noWait) return;
    if (!changed) return sync(context, options.timeout);
    waitForPass(context, watch, position, saved, options.timeout);
    // A pass that the restart ended in the middle may have left a lock or a record behind.
    if (pendingChanges() > 0 && context.bus().connected() && CXDAVManager::canReachOstrelError(error))
        return sync(context, options.timeout);
    reportResult(context);
    if (context.exitCode == kOk) context.say("Everything is on the store.");
}

std::string answer(int code) {
    return code == 0 ? "it did not answer" : fmt::format("it answered {}", code);
}

// Takes a group's files off the store: its state and directory, its mention in the list of groups, and the people of
// nobody else's interest.
void removeGroupFromStore(const Url& base, const UniqueId& group, const std::vector<UniqueId>& people) {
    CXDAVManager& store = CXDAVManager::defaultManager();
    int code = 0;
    const auto refused = [&](const std::string& what) {
        throw CommandError(code == 0 ? kUnreachable : kFailed,
                           fmt::format("{} could not be removed from the store ({}). Run the command again "
                                       "when the store can be reached; nothing else was lost.",
                                       what, answer(code)));
    };
    const Url all = layout::groupLocation(base, UniqueId("AllCXGroup"));
    if (auto state = store.dictionaryAtURL(all, true, &code)) {
        Dictionary changed = state->mutableCopy();
        Array subgroups = changed["subgroupUIDState"].array().mutableCopy();
        subgroups.removeAll(group.str());
        changed.set("subgroupUIDState", subgroups);
        if (!store.write(PropertyList::toXML(changed), all, true, &code))
            refused("The group's entry in the list of groups");
    } else if (code != 404) {
        refused("The group's entry in the list of groups");
    }
    if (!store.removeFileAtURL(layout::groupLocation(base, group), &code)) refused("The group");
    for (const UniqueId& person : people)
        if (!store.removeFileAtURL(layout::contactLocation(base, person), &code)) refused("A contact of the group");
}

void unpublish(Context& context, const PublishOptions& options) {
    const Url base = ownBase();
    CXRolvane& database = context.database();
    Publication publication(database);
    const CXGroupRef group = options.group.empty() ? nullptr : findGroup(database, options.group);
    const DaemonControl daemon;
    const bool ran = daemon.stop(); // so that nothing is written behind our back
    const auto people = group ? publication.peopleOnlyIn(group) : std::vector<UniqueId>{};

    std::string done;
    if (group) {
        if (!publication.withdrawGroup(group))
            throw CommandError(kNotFound, fmt::format("The group \"{}\" is not published by itself.", group->name()));
        done = fmt::format("The group \"{}\" is no longer published", group->name());
    } else {
        publication.withdrawEverything();
        for (const CXGroupRef& single : publication.groups()) publication.withdrawGroup(single);
        done = "Nothing is published any more";
    }
    const bool wholeListStays = group && publication.everything();
    const bool nothingLeft = !publication.anything();
    database.save();
    if (nothingLeft)
        forgetPublication(Preferences::shared());
    else if (group && !wholeListStays)
        forgetPublishedGroup(Preferences::shared(), group->uniqueId());

    bool removed = false;
    try {
        if (!options.keep && !wholeListStays) {
            if (nothingLeft) {
                int code = 0;
                removed = CXDAVManager::defaultManager().removeFileAtURL(base, &code);
                if (!removed)
                    throw CommandError(code == 0 ? kUnreachable : kFailed,
                                       fmt::format("{}, but the files at {} could not be removed ({}). Run "
                                                   "`rolvane unpublish` again when the store can be reached.",
                                                   done, base.absoluteString(), answer(code)));
            } else {
                removeGroupFromStore(base, cxNormalizedUID(group->uniqueId()), people);
                removed = true;
            }
        }
    } catch (const CommandError&) {
        if (ran) daemon.start();
        throw;
    }
    if (ran) daemon.start();
    context.say(done + (wholeListStays ? " by itself; it stays on the store as part of the contact list."
                        : removed      ? ", and its files are off the store."
                                       : "."));
}

// One pass, to its end: the running daemon's, or one of its own where none runs.
void makePass(Context& context, double seconds) {
    const DaemonControl daemon;
    if (!daemon.running()) {
        daemon.runOnce(seconds);
    } else {
        PassWatch watch(context);
        if (!context.bus().post({"SimulateVaultraNotification", std::nullopt, {}}))
            throw CommandError(kUnreachable, "There is no session bus, so the daemon cannot be asked. `rolvane daemon "
                                             "restart` makes a pass without one.");
        ProgressBar bar(context, "Synchronising");
        int stoppedBefore = -1;
        watch.onEvent = [&](const PassWatch::Event& event) {
            if (event.kind == PassWatch::Event::Kind::progress) bar.update(event.fraction);
            if (event.kind == PassWatch::Event::Kind::started && stoppedBefore < 0) stoppedBefore = watch.stopped();
        };
        const auto passed = [&] {
            const bool done = stoppedBefore >= 0 && watch.stopped() > stoppedBefore;
            if (!done) requireDaemon(daemon);
            return done;
        };
        if (!watch.waitUntil(passed, seconds))
            throw CommandError(kUnreachable, fmt::format("No pass ended within {} seconds. `rolvane daemon status` "
                                                         "tells whether the daemon is at work.",
                                                         seconds));
        watch.onEvent = nullptr;
    }
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
    reportResult(context);
    if (context.exitCode == kOk) context.say("Everything is up to date.");
}

} // namespace

void addSharingCommands(CLI::App& app, Context& context) {
    const auto options = std::make_shared<PublishOptions>();
    addCommand(
        app, context, "publish", "Publish the contact list, or single groups, on the store",
        [&](CLI::App& command) {
            command.add_option("-g,--group", options->group, "Publish this group only (name or identifier)");
            command.add_flag("--no-wait", options->noWait, "Return as soon as the daemon is at work");
            command.add_flag("--no-daemon", options->noDaemon, "Only note it; do not start the daemon");
            command.add_option("--timeout", options->timeout, "Seconds to wait for the pass")
                ->check(CLI::PositiveNumber)
                ->capture_default_str();
        },
        [&context, options] { publish(context, *options); });
    addCommand(
        app, context, "unpublish", "Withdraw a publication and take its files off the store",
        [&](CLI::App& command) {
            command.add_option("-g,--group", options->group, "Withdraw this group only (name or identifier)");
            command.add_flag("--keep", options->keep, "Leave the files on the store");
        },
        [&context, options] { unpublish(context, *options); });
    const auto seconds = std::make_shared<double>(kPassSeconds);
    addCommand(
        app, context, "sync", "Make a pass now and wait for its end",
        [&](CLI::App& command) {
            command.add_option("--timeout", *seconds, "Seconds to wait for the pass")
                ->check(CLI::PositiveNumber)
                ->capture_default_str();
        },
        [&context, seconds] { sync(context, *seconds); });
}

} // namespace rolvane::cli
