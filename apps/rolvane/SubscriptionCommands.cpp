#include "AskAgain.h"
#include "Consent.h"
#include "Context.h"
#include "FailureText.h"
#include "PassReport.h"
#include "Passes.h"
#include "Publication.h"
#include "Shown.h"
#include "Subscribe.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include "conduits/PublishedLayout.h"
#include "daemon/DaemonControl.h"
#include "engine/memory/EngineState.h"
#include "engine/pass/StoreFailures.h"
#include "foundation/Log.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

constexpr const char* kSubscriptionListChanged = "CXSubscriptionListChanged";
constexpr int kForbidden = 403;
constexpr int kMissing = 404;

struct SubscribeOptions {
    std::string named;
    bool noWait = false, noDaemon = false, dryRun = false;
    double timeout = kPassSeconds;
};

// Asks the store whether there is something that may be read, and says clearly why not.
void requirePublication(Context& context, const RemoteLocation& location) {
    const std::string user = publisherOf(location), self = CXDAVManager::vaultraUser();
    const Url info = Url(location.str()).cxURLByAppendingComponent(layout::kInfo);
    CXDAVManager& store = CXDAVManager::defaultManager();
    AskAgain again(context);
    int code = 0;
    std::vector<PassFailure> requests;
    do {
        if (store.dictionaryAtURL(info, false, &code)) return;
        requests = takeFailures(store);
        requireStore(context, translated("Nothing was subscribed to."));
    } while (code != kForbidden && code != kMissing && !requests.empty() && again.after(requests.back()));
    if (code == kForbidden)
        throw CommandError(kRefused, tr("The store does not let you read the contacts of \"{0}\". Check the "
                                        "name, or ask for the right to read: `rolvane share {1}`, typed by "
                                        "{0}, grants it.",
                                        user, self));
    if (code == kMissing)
        throw CommandError(kNotFound, tr("\"{0}\" has published nothing on this store. Check the name, or ask "
                                         "{0} to publish, with `rolvane publish`.",
                                         user));
    FailureScene scene = sceneOfTheAccount(Clock::system().now());
    scene.user = user;
    scene.reads = true;
    const FailureText text = requests.empty() ? FailureText{kUnreachable, translated("The store did not answer."), {}}
                                              : failureText(requests.back(), scene);
    throw CommandError(text.code, tr("What \"{}\" has published could not be read. {} Nothing was subscribed "
                                     "to; try again later.",
                                     user, text.what));
}

Json described(CXRolvane& database, const CXSubscriptionRef& subscription) {
    Preferences& preferences = Preferences::shared();
    const RemoteLocation location = subscription->remoteLocation();
    const Value seen = preferences.get(kDaemonDomain, kCXDVaultraConduitLastSyncDate);
    const bool known = wasRead(preferences, location);
    return {{"user", publisherOf(location)},
            {"location", location.str()},
            {"people", database.countPeople(location)},
            {"groups", database.listGroups(location).size()},
            {"writable", subscription->isWritable()},
            {"pending", pendingFor(preferences, location)},
            {"lastSeen", known && seen.date() ? Json(seen.date()->toISO8601()) : Json()}};
}

std::string amount(const Json& subscription) {
    return amountText(subscription["people"].get<size_t>(), subscription["groups"].get<size_t>());
}

// subscribe --------------------------------------------------------------------------------------------------------

void startDaemonFor(PassWatch& watch, bool served) {
    const DaemonControl daemon;
    if (!daemon.running())
        daemon.start();
    else if (!served || !watch.tell(kSubscriptionListChanged).value_or(false))
        daemon.restart(); // one that started with nothing shared acts on nothing
}

// Waits for the pass that brings the people, and tells what came.
void waitForPeople(Context& context, PassWatch& watch, OutcomeWatch& outcomes, const RemoteLocation& location,
                   int64_t position, double seconds) {
    CXRolvane& database = context.database();
    const std::string user = publisherOf(location);
    PassOutcome outcome = waitForPass(context, watch, outcomes, translated("Fetching"), position, seconds);
    const auto cameWhole = [&] {
        const PassTree* tree = outcome.tree(UserName(user));
        return isComplete(outcome) && tree && tree->in.reached && tree->in.waiting == 0;
    };
    // The pass may have carried changes alone, or may have been ended in the middle by the restart. Or the store was
    // too busy for it: many may have begun at this moment.
    AskAgain again(context);
    for (int passes = 0; !cameWhole() && database.findSubscriptionWithRemoteLocation(location); ++passes) {
        const PassTree* tree = outcome.tree(UserName(user));
        const auto why = tree && tree->in.why ? tree->in.why : firstFailure(outcome);
        if (!(why && again.after(*why)) && (passes >= 2 || !outcome.storeReached)) break;
        outcome = makePass(context, seconds);
    }
    const CXSubscriptionRef subscription = database.findSubscriptionWithRemoteLocation(location);
    if (!subscription)
        throw CommandError(kRefused, tr("The store let go of the contacts of \"{}\" while they were fetched: "
                                        "they are withdrawn, and the subscription has ended.",
                                        user));
    if (!cameWhole()) context.warn(tr("Not all contacts of \"{}\" have come yet.", user));
    const bool well = report(context, outcome, {});
    Json data = described(database, subscription);
    data["pass"] = outcomeJson(outcome);
    if (context.json) context.print(data);
    if (well && cameWhole())
        context.say(data["writable"].get<bool>()
                        ? tr("{} of \"{}\" are here; you may change them.", amount(data), user)
                        : tr("{} of \"{}\" are here; you may read them but not change them.", amount(data), user));
    else if (well)
        context.exitCode = kFailed;
}

// How much lies there, by the list of everybody; nothing is fetched but that one.
void tellSubscribing(Context& context, const RemoteLocation& location) {
    const auto all = CXDAVManager::defaultManager().dictionaryAtURL(
        layout::groupLocation(Url(location.str()), UniqueId(layout::kAllGroup)), false, nullptr);
    const std::string user = publisherOf(location);
    if (!all)
        throw CommandError(kUnreachable,
                           tr("The list of what \"{}\" has published could not be read. Try again later.", user));
    const size_t people = (*all)["memberUIDState"].array().count(), groups = (*all)["subgroupUIDState"].array().count();
    if (context.json)
        context.print(Json{
            {"dryRun", true}, {"user", user}, {"location", location.str()}, {"people", people}, {"groups", groups}});
    context.say(tr("{} and {} of \"{}\" would come. Nothing was changed: this was a trial.",
                   countedText(people, "person", "people"), countedText(groups, "group", "groups"), user));
}

void subscribe(Context& context, const SubscribeOptions& options) {
    (void)ownBase();
    const RemoteLocation location = namedLocation(options.named);
    const std::string user = publisherOf(location), self = CXDAVManager::vaultraUser();
    if (userForRemoteLocation(location, UserName(self), {}) == kSelf)
        throw CommandError(kRefused, tr("\"{}\" is your own account. `rolvane join` brings what another computer "
                                        "has published of it; `rolvane publish` shares what is here.",
                                        user));
    CXRolvane& database = context.database();
    if (database.findSubscriptionWithRemoteLocation(location))
        throw CommandError(kRefused, tr("You are subscribed to \"{}\" already. `rolvane sync` brings what is "
                                        "new, `rolvane subscriptions` tells how it stands.",
                                        user));
    requirePublication(context, location);
    if (options.dryRun) return tellSubscribing(context, location);

    const bool served = Publication(database).anything() || !subscriptionsToPeople(database).empty();
    PassWatch watch(context, !context.quiet);
    database.addRecord(CXSubscription::create(location));
    database.save();
    const int64_t position = database.journalPosition();
    OutcomeWatch outcomes(context);
    context.say(tr("You are subscribed to \"{}\" at {}.", user, location.str()));
    if (!options.noDaemon) startDaemonFor(watch, served);
    if (!options.noDaemon && !options.noWait)
        waitForPeople(context, watch, outcomes, location, position, options.timeout);
    else if (context.json)
        context.print(described(database, database.findSubscriptionWithRemoteLocation(location)));
}

// unsubscribe ------------------------------------------------------------------------------------------------------

// One save takes the subscription and all that came by it away. The daemon rests meanwhile, and what it remembers of
// the publisher goes before it starts again: nothing of this is an edit that would be carried to the publisher's store.
void unsubscribe(Context& context, const std::string& named, bool yes) {
    CXRolvane& database = context.database();
    const CXSubscriptionRef subscription = findSubscription(database, named);
    const RemoteLocation location = subscription->remoteLocation();
    const size_t unsent = unsentTo(database, Preferences::shared(), location);
    if (unsent > 0)
        requireConsent(context, yes,
                       unsent == 1
                           ? tr("Unsubscribe from \"{}\"? 1 change of yours has not been sent yet, and is dropped.",
                                publisherOf(location))
                           : tr("Unsubscribe from \"{}\"? {} changes of yours have not been sent yet, and are dropped.",
                                publisherOf(location), shownNumber(unsent)),
                       translated("You are still subscribed."));
    const DaemonControl daemon;
    const bool ran = daemon.stop();
    const size_t lost = unsentTo(database, Preferences::shared(), location);
    const Json data = described(database, subscription);
    try {
        const UniqueId identifier = subscription->uniqueId();
        database.removeRecord(subscription);
        database.save();
        forgetSubscription(Preferences::shared(), location, identifier);
    } catch (const CXException&) {
        if (ran) daemon.start();
        throw;
    }
    context.bus().post({kSubscriptionListChanged, std::nullopt, {}});
    if (ran) daemon.start();
    if (context.json) context.print(data);
    context.say(
        tr("You are no longer subscribed to \"{}\"; {} left with it.", data["user"].get<std::string>(), amount(data)));
    if (lost > 0)
        context.warn(lost == 1 ? translated("1 change of yours had not been sent yet and is dropped.")
                               : tr("{} changes of yours had not been sent yet and are dropped.", shownNumber(lost)));
}

// subscriptions ----------------------------------------------------------------------------------------------------

void listSubscriptions(Context& context) {
    CXRolvane& database = context.database();
    Json all = Json::array();
    for (const CXSubscriptionRef& s : subscriptionsToPeople(database)) all.push_back(described(database, s));
    if (context.json) return context.print(all);
    if (all.empty()) context.say(translated("There is none. `rolvane subscribe USER` makes one."));
    for (const Json& s : all) {
        context.line(fmt::format("{}  {}", s["user"].get<std::string>(), s["location"].get<std::string>()));
        context.line(fmt::format("    {}, {}, {}", amount(s),
                                 s["writable"].get<bool>() ? translated("read and write") : translated("read only"),
                                 s["lastSeen"].is_null()
                                     ? translated("not read yet")
                                     : tr("last seen {}", shownDate(s["lastSeen"].get<std::string>()))));
        if (const size_t pending = s["pending"]; pending > 0)
            context.line(tr("    {} to be sent", countedText(pending, "change waits", "changes wait")));
    }
}

} // namespace

void subscribeTo(Context& context, const std::string& user) {
    SubscribeOptions options;
    options.named = user;
    subscribe(context, options);
}

void addSubscriptionCommands(CLI::App& app, Context& context) {
    const auto options = std::make_shared<SubscribeOptions>();
    addCommand(
        app, context, "subscribe", "Take what another user has published, and keep it in step",
        [&](CLI::App& command) {
            command.add_option("user", options->named, "User name on the store, or a location")
                ->required()
                ->type_name(kUserValue);
            declareTrial(command, options->dryRun);
            command.add_flag("--no-wait", options->noWait, "Return as soon as the daemon is at work");
            command.add_flag("--no-daemon", options->noDaemon, "Only note it; do not start the daemon");
            command.add_option("--timeout", options->timeout, "Seconds to wait for the pass")
                ->check(CLI::PositiveNumber)
                ->capture_default_str();
        },
        [&context, options] { subscribe(context, *options); });
    const auto named = std::make_shared<std::string>();
    const auto yes = std::make_shared<bool>(false);
    addCommand(
        app, context, "unsubscribe", "End a subscription; what came by it leaves this database",
        [&](CLI::App& command) {
            command.add_option("user", *named, "User name or location")->required()->type_name(kPublisherValue);
            declareConsent(command, *yes);
        },
        [&context, named, yes] { unsubscribe(context, *named, *yes); });
    addCommand(app, context, "subscriptions", "List the subscriptions: whose, how much, and what you may do", nullptr,
               [&context] { listSubscriptions(context); });
}

} // namespace rolvane::cli
