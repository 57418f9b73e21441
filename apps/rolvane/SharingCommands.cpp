#include "Context.h"
#include "Lookup.h"
#include "Passes.h"
#include "Publication.h"

#include "conduits/PublishedLayout.h"
#include "contacts/Constants.h"
#include "daemon/DaemonControl.h"
#include "foundation/PropertyList.h"
#include "store/CXDAVManager.h"
#include "store/CXWebDAVLock.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

struct PublishOptions {
    std::string group;
    bool noWait = false, noDaemon = false, keep = false;
    double timeout = kPassSeconds;
};

void publish(Context& context, const PublishOptions& options) {
    const Url base = ownBase();
    CXRolvane& database = context.database();
    Publication publication(database);
    const bool served = publication.anything();

    CXDAVError error;
    if (!CXDAVManager::canReachOstrelError(error) && error.code == kCXDAVErrorAuthentication)
        throw CommandError(kRefused, error.reason + " Nothing was published.");

    PassWatch watch(context, !context.quiet);
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
    waitForPass(context, watch, "Publishing", position, saved, options.timeout);
    // A pass that the restart ended in the middle may have left a lock or a record behind.
    if (pendingChanges() > 0 && context.bus().connected() && CXDAVManager::canReachOstrelError(error))
        return sync(context, options.timeout);
    reportPending(context);
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
            releaseLocksOfEndedRuns(CXDAVManager::defaultManager()); // they keep files on the store
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
