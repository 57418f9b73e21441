#include "Computers.h"
#include "Consent.h"
#include "Context.h"
#include "FailureText.h"
#include "LeftOnStore.h"
#include "Lookup.h"
#include "PassReport.h"
#include "Passes.h"
#include "Publication.h"
#include "Shares.h"
#include "Shown.h"
#include "Texts.h"
#include "ValueNames.h"

#include "daemon/DaemonControl.h"
#include "store/dav/CXDAVManager.h"

#include <fmt/format.h>
#include <functional>

namespace rolvane::cli {

namespace {

struct PublishOptions {
    std::string group;
    bool noWait = false, noDaemon = false, keep = false, forgetShares = false, yes = false, dryRun = false,
         replace = false, allComputers = false;
    double timeout = kPassSeconds;
};

// Whatever comes of the action, the daemon runs again in the end when it ran before.
void whileDaemonRests(const std::function<void()>& action) {
    const DaemonControl daemon;
    const bool ran = daemon.stop();
    try {
        action();
    } catch (const CXException&) {
        if (ran) daemon.start();
        throw;
    }
    if (ran) daemon.start();
}

CommandError notRemoved(const LeftOnStore::Failure& failure, const std::string& message) {
    constexpr int kUnauthorized = 401, kForbidden = 403;
    const bool isRefused = failure.code == kUnauthorized || failure.code == kForbidden;
    return {failure.code == 0 ? kUnreachable : isRefused ? kRefused : kFailed, message};
}

// Files that nothing else knows of are not to stay among what is published now.
void removeWhatIsLeft(CXRolvane& database, const Url& base) {
    LeftOnStore left(database, Preferences::shared(), base);
    if (!left.anything()) return;
    whileDaemonRests([&] {
        if (const auto failure = left.remove())
            throw notRemoved(*failure, tr("Of an earlier withdrawal {} could not be removed from the store "
                                          "({}). Nothing was published; run the command again when the store "
                                          "can be reached.",
                                          failure->what, failure->answer()));
    });
}

void withdrawAll(Publication& publication) {
    publication.withdrawEverything();
    for (const CXGroupRef& single : publication.groups()) publication.withdrawGroup(single);
}

// The people and groups that would be new to the readers. The database stays as it is.
Shown newlyShown(CXRolvane& database, const CXGroupRef& group, const Url& base) {
    Publication publication(database);
    const Shown before = shownToReaders(database);
    group ? publication.publishGroup(group, base) : publication.publishEverything(base);
    const Shown more = without(shownToReaders(database), before);
    database.rollback();
    return more;
}

// And what would be seen no longer.
Shown nextHidden(CXRolvane& database, const CXGroupRef& group) {
    Publication publication(database);
    const Shown before = shownToReaders(database);
    group ? (void)publication.withdrawGroup(group) : withdrawAll(publication);
    const Shown less = without(before, shownToReaders(database));
    database.rollback();
    return less;
}

std::string namedWhole(const CXGroupRef& group) {
    return group ? tr("the group \"{}\"", group->name()) : translated("all contacts");
}

void tellTrial(Context& context, const Shown& what, const std::vector<std::string>& users,
               const std::string& sentence) {
    if (context.json) context.print(trialJson(what, users));
    context.say(sentence + translated(" Nothing was changed: this was a trial."));
}

void tellPublishing(Context& context, const CXGroupRef& group, const Url& base) {
    CXRolvane& database = context.database();
    const Shown more = newlyShown(database, group, base);
    const std::vector<std::string> readers = Shares(database).readers();
    const std::string what =
        more.empty() && (Publication(database).everything() || (group && Publication(database).publishes(group)))
            ? tr("Of {} everything is published already", namedWhole(group))
            : tr("{} would go to {}", more.amount(), base.absoluteString());
    tellTrial(context, more, readers,
              readers.empty() ? tr("{}. You share with nobody yet.", what)
                              : tr("{}, readable for {}.", what, usersText(readers)));
}

void askAboutReaders(Context& context, const PublishOptions& options, const CXGroupRef& group, const Url& base) {
    const std::vector<std::string> readers = Shares(context.database()).readers();
    if (readers.empty()) return;
    const Shown more = newlyShown(context.database(), group, base);
    if (more.empty()) return;
    requireConsent(
        context, options.yes,
        more.isOne()
            ? tr("Publish {}? {} becomes readable for {}.", namedWhole(group), more.amount(), usersText(readers))
            : tr("Publish {}? {} become readable for {}.", namedWhole(group), more.amount(), usersText(readers)),
        translated("Nothing was published."));
}

void publish(Context& context, const PublishOptions& options) {
    const Url base = ownBase();
    CXRolvane& database = context.database();
    const CXGroupRef group = options.group.empty() ? nullptr : findGroup(database, options.group);
    if (options.dryRun) return tellPublishing(context, group, base);
    Publication publication(database);
    const bool served = publication.anything();

    if (const auto failure = testStore()) {
        const FailureText text = failureText(*failure, sceneOfTheAccount(Clock::system().now()));
        if (text.code == kRefused)
            throw CommandError(kRefused, text.what + " " + text.toDo + " " + translated("Nothing was published."));
    } else if (!served) {
        requireUsableStore(translated("Nothing was published."));
        if (!options.replace) requireOwnTree(CXDAVManager::defaultManager(), Preferences::shared());
    }
    askAboutReaders(context, options, group, base);
    removeWhatIsLeft(database, base);

    PassWatch watch(context, !context.quiet);
    const bool changed = group ? publication.publishGroup(group, base) : publication.publishEverything(base);
    database.save();
    const int64_t position = database.journalPosition();
    OutcomeWatch outcomes(context);
    const std::string what = group ? tr("The group \"{}\"", group->name()) : translated("The contact list");
    context.say(changed ? tr("{} is published at {}.", what, base.absoluteString())
                        : tr("{} is published already at {}.", what, base.absoluteString()));
    if (options.noDaemon) return;
    // A daemon that started with nothing shared serves nothing: it decides when it starts.
    const DaemonControl daemon;
    if (!served && daemon.running())
        daemon.restart();
    else
        daemon.start();
    if (options.noWait) return;
    if (!changed) return sync(context, options.timeout);
    PassOutcome outcome = waitForPass(context, watch, outcomes, translated("Publishing"), position, options.timeout);
    // A pass that the restart ended in the middle may have left a lock or a record behind.
    if (mayGoBetter(outcome)) outcome = makePass(context, options.timeout);
    report(context, outcome, translated("Everything is on the store."), true);
    if (!group && isComplete(outcome)) noteThisComputer(CXDAVManager::defaultManager(), Preferences::shared());
    if (context.json) context.print(outcomeJson(outcome));
}

// What is withdrawn, as the beginning of a sentence.
std::string withdraw(Publication& publication, LeftOnStore& left, const CXGroupRef& group) {
    if (!group) {
        withdrawAll(publication);
        return translated("Nothing is published any more");
    }
    const bool wasLeft = left.isLeft(group->uniqueId());
    if (!publication.withdrawGroup(group) && !wasLeft)
        throw CommandError(kNotFound, tr("The group \"{}\" is not published by itself.", group->name()));
    return tr("The group \"{}\" is no longer published", group->name());
}

void unpublishAtRest(Context& context, const PublishOptions& options, const CXGroupRef& group) {
    CXRolvane& database = context.database();
    Preferences& preferences = Preferences::shared();
    Publication publication(database);
    LeftOnStore left(database, preferences, ownBase());
    const auto people = group ? publication.peopleOnlyIn(group) : std::vector<UniqueId>{};
    const bool isNews = group && publication.publishes(group);
    const std::string done = withdraw(publication, left, group);
    if (options.forgetShares && !publication.anything()) Shares(database).denyAll();
    const bool wholeListStays = group && publication.everything();
    const bool nothingLeft = !publication.anything();
    const bool removes = !options.keep && !wholeListStays;
    if (removes && nothingLeft)
        left.noteTree();
    else if (removes && isNews)
        left.noteGroup(group->uniqueId(), people);
    database.save();
    if (nothingLeft)
        forgetPublication(preferences);
    else if (!wholeListStays)
        forgetPublishedGroup(preferences, group->uniqueId());
    if (options.keep) nothingLeft ? left.forgetTree() : left.forgetGroup(group->uniqueId());

    if (const auto failure = removes ? left.remove() : std::nullopt)
        throw notRemoved(*failure, tr("{}, but {} could not be removed from the store ({}). Run the command "
                                      "again when the store can be reached; nothing else was lost.",
                                      done, failure->what, failure->answer()));
    if (context.json)
        context.print({{"group", group ? nlohmann::ordered_json(group->name()) : nlohmann::ordered_json()},
                       {"stillPublished", publication.anything()},
                       {"removedFromStore", removes}});
    context.say(wholeListStays ? tr("{} by itself; it stays on the store as part of the contact list.", done)
                : removes      ? tr("{}, and its files are off the store.", done)
                               : done + ".");
}

void tellWithdrawal(Context& context, const PublishOptions& options, const CXGroupRef& group) {
    CXRolvane& database = context.database();
    if (group && !Publication(database).publishes(group))
        throw CommandError(kNotFound, tr("The group \"{}\" is not published by itself.", group->name()));
    const Shown gone = nextHidden(database, group);
    const std::vector<std::string> readers = Shares(database).readers();
    const std::string what = options.keep ? tr("{} would no longer be kept in step on the store", gone.amount())
                                          : tr("{} would leave the store", gone.amount());
    tellTrial(context, gone, readers,
              !Publication(database).anything() ? translated("Nothing is published.")
              : gone.empty()
                  ? translated("Nothing would leave the store: the group stays there as part of the contact list.")
              : readers.empty() ? tr("{}. You share with nobody.", what)
              : gone.isOne()    ? tr("{}, where {} could read it.", what, usersText(readers))
                                : tr("{}, where {} could read them.", what, usersText(readers)));
}

// "Take off the store 318 people? 1 user (bob) loses them."
std::string withdrawalQuestion(const Shown& gone, const std::vector<std::string>& readers, bool keep) {
    const std::string what = gone.amount(), users = usersText(readers);
    const bool oneUser = readers.size() == 1, it = gone.isOne();
    if (readers.empty())
        return keep ? tr("Stop publishing {}? You share with nobody; the files stay there.", what)
                    : tr("Take off the store {}? You share with nobody.", what);
    if (keep && oneUser)
        return it ? tr("Stop publishing {}? {} gets no more news of it; the files stay there.", what, users)
                  : tr("Stop publishing {}? {} gets no more news of them; the files stay there.", what, users);
    if (keep)
        return it ? tr("Stop publishing {}? {} get no more news of it; the files stay there.", what, users)
                  : tr("Stop publishing {}? {} get no more news of them; the files stay there.", what, users);
    if (oneUser)
        return it ? tr("Take off the store {}? {} loses it.", what, users)
                  : tr("Take off the store {}? {} loses them.", what, users);
    return it ? tr("Take off the store {}? {} lose it.", what, users)
              : tr("Take off the store {}? {} lose them.", what, users);
}

// Asks before anything leaves the store, and anybody's database with it.
void askAboutWithdrawal(Context& context, const PublishOptions& options, const CXGroupRef& group) {
    CXRolvane& database = context.database();
    if (group ? !Publication(database).publishes(group) : !Publication(database).anything()) return;
    const Shown gone = nextHidden(database, group);
    if (group && gone.empty()) return; // it stays as a part of the contact list
    const std::vector<std::string> readers = Shares(database).readers();
    requireConsent(context, options.yes, withdrawalQuestion(gone, readers, options.keep),
                   translated("Everything is still published."));
}

void unpublish(Context& context, const PublishOptions& options) {
    ownBase(); // there is an account
    Preferences& preferences = Preferences::shared();
    if (!options.allComputers && Publication(context.database()).everything())
        requireNoOtherComputer(CXDAVManager::defaultManager(), preferences);
    const CXGroupRef group = options.group.empty() ? nullptr : findGroup(context.database(), options.group);
    if (options.dryRun) return tellWithdrawal(context, options, group);
    askAboutWithdrawal(context, options, group);
    whileDaemonRests([&] {
        unpublishAtRest(context, options, group);
        if (isOneOfSeveral(preferences)) becomeTheOnlyOne(preferences);
    }); // nothing is written behind our back
}

} // namespace

void addSharingCommands(CLI::App& app, Context& context) {
    const auto options = std::make_shared<PublishOptions>();
    addCommand(
        app, context, "publish", "Publish the contact list, or single groups, on the store",
        [&](CLI::App& command) {
            command.add_option("-g,--group", options->group, "Publish this group only (name or identifier)")
                ->type_name(kGroupValue);
            command.add_flag("--replace", options->replace,
                             "Publish over what another computer of yours has published");
            declareConsent(command, options->yes);
            declareTrial(command, options->dryRun);
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
            command.add_option("-g,--group", options->group, "Withdraw this group only (name or identifier)")
                ->type_name(kGroupValue);
            command.add_flag("--keep", options->keep, "Leave the files on the store");
            command.add_flag("--forget-shares", options->forgetShares,
                             "Forget with whom you share, too, when nothing stays published; without it, the next "
                             "publication is shared with the same users");
            command.add_flag("--all-computers", options->allComputers,
                             "Also where other computers of yours keep them in step");
            declareConsent(command, options->yes);
            declareTrial(command, options->dryRun);
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
