#include "Context.h"
#include "FailureText.h"
#include "PassReport.h"
#include "Passes.h"
#include "Publication.h"
#include "Shares.h"
#include "Shown.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include "acl/CXDAVACLManager.h"
#include "daemon/DaemonControl.h"
#include "engine/memory/RightsTakenBack.h"
#include "model/CXDChangeRecord.h"
#include "model/Computers.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

constexpr const char* kAllACLChanged = "CXAllACLChanged";

struct ShareOptions {
    std::string user;
    bool write = false, dryRun = false, noWait = false, noDaemon = false;
    double timeout = kPassSeconds;
};

// What the store itself says of the owner's tree.
struct StoreLists {
    std::vector<std::string> readers, writers;
    static bool in(const std::vector<std::string>& list, const std::string& user) {
        return std::find(list.begin(), list.end(), user) != list.end();
    }
    const char* rightsOf(const std::string& user) const {
        return in(writers, user) ? "write" : in(readers, user) ? "read" : nullptr;
    }
};

std::optional<StoreLists> storeLists(const Url& base) {
    StoreLists lists;
    if (!CXDAVManager::defaultManager().ACLsAtURL(base, lists.readers, lists.writers)) return std::nullopt;
    return lists;
}

const char* rightsHere(const Shares& shares, const std::string& user) {
    return shares.mayWrite(user) ? "write" : shares.mayRead(user) ? "read" : nullptr;
}

bool same(const char* a, const char* b) {
    return a && b ? std::string_view(a) == b : a == b;
}

Json orNull(const char* text) {
    return text ? Json(text) : Json();
}

Json orNull(const std::optional<Date>& date) {
    return date ? Json(date->toISO8601()) : Json();
}

// Refuses where the store cannot do what is asked.
void requireAccessLists(Context& context, const Url& base, const std::string& user) {
    requireStore(context, translated("Nothing was changed."));
    const auto keeps = CXDAVManager::defaultManager().keepsAccessLists();
    if (!keeps)
        throw CommandError(kUnreachable,
                           translated("The store does not say whether it keeps access lists. Nothing was changed; "
                                      "try again later."));
    if (*keeps) return;
    const auto place = CXDAVManager::defaultManager().account().endpointFor(base, true);
    throw CommandError(kFailed, tr("The store keeps no access lists (RFC 3744), so nothing was changed: who "
                                   "may read is written in the server's own configuration. Ask its "
                                   "administrator to let \"{}\" read {}, or to load mod_davacl.",
                                   user, place ? place->absoluteString() : base.absoluteString()));
}

std::string checkedUser(const std::string& user) {
    const std::string self = CXDAVManager::vaultraUser();
    if (user.empty()) throw CommandError(kUsage, translated("Name the user."));
    if (userForRemoteLocation(
            RemoteLocation(CXDAVManager::ostrelBaseLocationForOstrelUser(UserName(user)).absoluteString()),
            UserName(self), {}) == kSelf)
        throw CommandError(kRefused, tr("\"{}\" is your own account, which may do everything.", user));
    return user;
}

// Takes rights back on the store itself, before anybody is told: from here on nothing more is written there, whatever
// the daemon waits for. A list that holds no such right stays as it is.
void takeBackOnStore(const Url& base, const std::string& user, bool reading) {
    CXDAVManager& manager = CXDAVManager::defaultManager();
    auto lists = storeLists(base);
    if (!lists)
        throw CommandError(kUnreachable,
                           translated("The store does not show its access list. Nothing was changed; try again "
                                      "later."));
    if (!StoreLists::in(lists->writers, user) && !(reading && StoreLists::in(lists->readers, user))) return;
    std::erase(lists->writers, user);
    if (reading) std::erase(lists->readers, user);
    if (manager.setACLsWithReadPrincipals(lists->readers, lists->writers, base)) return;
    const auto now = storeLists(base); // a list may be set and yet not be all that was asked for
    if (!now || StoreLists::in(now->writers, user) || (reading && StoreLists::in(now->readers, user)))
        throw CommandError(
            kFailed, translated("The store did not take the right back. Nothing was changed here; try again later."));
}

// What the last writer wrote while it was allowed belongs to the owner, too, and a daemon that starts without a writer
// takes nothing from the store. So the one that knows of the writer makes another pass.
void takeInWhatWasWritten(Context& context, double seconds) {
    try {
        makePass(context, seconds);
    } catch (const CXException& error) { // the right is taken back all the same
        context.warn(tr("What was written last may be missing here: {}", error.reason()));
    }
}

// Has the daemon carry the lists to the store, and tells whether they are there. The outcome of the pass that did it;
// nothing where nobody waits for one.
std::optional<PassOutcome> carry(Context& context, PassWatch& watch, const ShareOptions& options, const Url& base) {
    CXRolvane& database = context.database();
    const int64_t position = database.journalPosition();
    OutcomeWatch outcomes(context);
    const DaemonControl daemon;
    if (!daemon.start() && !watch.tell(kAllACLChanged).value_or(false)) daemon.restart();
    if (options.noWait) return std::nullopt;
    PassOutcome outcome = waitForPass(context, watch, outcomes, translated("Sharing"), position, options.timeout);
    const Shares shares(database);
    const auto agrees = [&] {
        const auto lists = storeLists(base);
        return lists && same(lists->rightsOf(options.user), rightsHere(shares, options.user));
    };
    bool done = agrees();
    if (!done && outcome.storeReached && isComplete(outcome)) {
        outcome = makePass(context, options.timeout);
        done = agrees();
    }
    if (done) {
        context.say(translated("The store has it."));
        return outcome;
    }
    const PassTree* own = outcome.tree(kSelf);
    const bool toldWhy = !outcome.storeReached || !isComplete(outcome) || !own || own->ended || own->out.why;
    if (toldWhy && !report(context, outcome, {}, true)) return outcome;
    throw CommandError(kFailed, tr("The store did not take it. Perhaps it knows no user \"{0}\": check the "
                                   "name, and take it back with `rolvane unshare {0}`.",
                                   options.user));
}

void tellSharing(Context& context, const ShareOptions& options, const std::string& user) {
    CXRolvane& database = context.database();
    const Shares shares(database);
    const Shown shown = shownToReaders(database);
    const bool same = shares.mayRead(user) && shares.mayWrite(user) == options.write;
    if (context.json) {
        Json data = trialJson(shares.mayRead(user) ? Shown() : shown, {user});
        data["rights"] = options.write ? "write" : "read";
        data["rightsNow"] = orNull(rightsHere(shares, user));
        context.print(data);
    }
    const std::string amount = shown.amount(), trial = translated(" Nothing was changed: this was a trial.");
    if (same)
        context.say(tr("\"{}\" may do so already.", user));
    else if (shares.mayRead(user))
        context.say((options.write
                         ? tr("{} would become changeable for \"{}\".", amount, user)
                         : tr("{} would no longer be changeable for \"{}\", who may go on reading.", amount, user)) +
                    trial);
    else
        context.say((options.write ? tr("{} would become readable and changeable for \"{}\".", amount, user)
                                   : tr("{} would become readable for \"{}\".", amount, user)) +
                    trial);
}

void changeShares(Context& context, const ShareOptions& options, bool grant) {
    const Url base = ownBase();
    const std::string user = checkedUser(options.user);
    CXRolvane& database = context.database();
    Shares shares(database);
    if (grant && !Publication(database).anything())
        throw CommandError(kRefused,
                           translated("Nothing is published yet, so there is nothing to share. `rolvane publish` comes "
                                      "first."));
    if (!grant && !shares.mayRead(user)) {
        const auto lists = Publication(database).anything() ? storeLists(base) : std::nullopt;
        if (!lists || !lists->rightsOf(user))
            throw CommandError(kNotFound, tr("You do not share with \"{}\". `rolvane shares` lists with whom "
                                             "you do.",
                                             user));
    }
    if (!Publication(database).anything()) { // the store has nothing of it: the right was kept for a next publication
        shares.deny(user);
        database.save();
        context.say(tr("\"{}\" will not read what you publish next.", user));
        if (context.json) context.print({{"user", user}, {"rights", nullptr}, {"pass", nullptr}});
        return;
    }
    if (options.dryRun) return tellSharing(context, options, user);
    requireAccessLists(context, base, user);

    const std::vector<std::string> writers = shares.writers();
    const bool takesBack = !grant || !options.write;
    if (takesBack && !options.noDaemon) takeBackOnStore(base, user, !grant);
    if (takesBack && !options.noDaemon && !options.noWait && writers == std::vector{user})
        takeInWhatWasWritten(context, options.timeout);

    PassWatch watch(context, !context.quiet);
    const bool hadWriters = !writers.empty();
    grant ? shares.grant(user, options.write) : shares.deny(user);
    // Only a daemon that knew of a writer when it started takes in changes that writers send. It rests before the
    // lists are saved: ended later, it would be in the middle of carrying them. So it does where its memory changes.
    const bool isForgotten = takesBack && !options.noDaemon && isOneOfSeveral(Preferences::shared());
    if (isForgotten || hadWriters == shares.writers().empty()) {
        const DaemonControl daemon;
        const bool ran = daemon.stop();
        try {
            database.save();
            if (isForgotten) forgetRightTakenBack(Preferences::shared(), user, !grant);
        } catch (const CXException&) {
            if (ran) daemon.start();
            throw;
        }
        if (ran && options.noDaemon) daemon.start();
    } else {
        database.save();
    }
    context.say(!grant          ? tr("\"{}\" may no longer read your contacts.", user)
                : options.write ? tr("\"{}\" may read and change your contacts.", user)
                                : tr("\"{}\" may read your contacts, not change them.", user));
    const auto outcome = options.noDaemon ? std::nullopt : carry(context, watch, options, base);
    if (context.json)
        context.print({{"user", user}, {"rights", orNull(rightsHere(shares, user))}, {"pass", outcomeJson(outcome)}});
}

// shares -----------------------------------------------------------------------------------------------------------

void listShares(Context& context) {
    const Url base = ownBase();
    const Shares shares(context.database());
    const auto lists = storeLists(base);
    std::vector<std::string> users = shares.readers();
    if (lists)
        for (const auto* list : {&lists->readers, &lists->writers})
            for (const std::string& user : *list)
                if (!StoreLists::in(users, user)) users.push_back(user);
    Json all = Json::array();
    for (const std::string& user : users) {
        const char *here = rightsHere(shares, user), *there = lists ? lists->rightsOf(user) : nullptr;
        all.push_back({{"user", user},
                       {"rights", orNull(here)},
                       {"readsSince", orNull(shares.readsSince(user))},
                       {"writesSince", orNull(shares.writesSince(user))},
                       {"store", orNull(there)},
                       {"agrees", lists ? Json(same(here, there)) : Json()}});
    }
    if (context.json) return context.print(all);
    if (all.empty()) context.say(translated("You share with nobody. `rolvane share USER` changes that."));
    const auto words = [](const Json& rights) {
        return rights.is_null()    ? translated("nothing")
               : rights == "write" ? translated("read and write")
                                   : translated("read");
    };
    const auto since = [](const Json& share) {
        const auto date = [&](const char* key) {
            return share[key].is_null() ? std::string("-") : shownDate(share[key].get<std::string>());
        };
        if (share["rights"].is_null()) return std::string();
        const std::string writes = share["rights"] == "write" ? tr(", writes since {}", date("writesSince")) : "";
        return tr("  reads since {}", date("readsSince")) + writes;
    };
    for (const Json& share : all)
        context.line(fmt::format("{}  {}{}{}", share["user"].get<std::string>(), words(share["rights"]), since(share),
                                 share["agrees"].is_null() ? translated("  (the store does not tell)")
                                 : share["agrees"]         ? ""
                                                           : tr("  (the store: {})", words(share["store"]))));
}

// rights -----------------------------------------------------------------------------------------------------------

class AccountOwner : public LocationOwner {
public:
    UserName userForRemoteLocation(const RemoteLocation& location) const override {
        return rolvane::userForRemoteLocation(location, UserName(CXDAVManager::vaultraUser()), {}).value_or(UserName());
    }
};

void showRights(Context& context, const std::string& named) {
    (void)ownBase();
    const RemoteLocation location = namedLocation(named);
    const std::string user = publisherOf(location);
    requireStore(context, translated("What you may do there is not known."));
    const AccountOwner owner;
    bool read = false, write = false;
    const bool own = owner.userForRemoteLocation(location) == kSelf;
    const bool lists = CXDAVManager::defaultManager().keepsAccessLists().value_or(false);
    if (own) {
        read = write = true;
    } else {
        read = mayBeRead(location);
        if (read && lists) {
            const CXDAVACLManager manager(Url(location.str()), owner, CXDAVManager::defaultManager());
            const auto& writers = manager.principalsWithAllAccess();
            write = std::find(writers.begin(), writers.end(), kSelf) != writers.end();
        }
    }
    const CXSubscriptionRef subscription = context.database().findSubscriptionWithRemoteLocation(location);
    const Json data{{"user", user},
                    {"location", location.str()},
                    {"read", read},
                    {"write", own || lists ? Json(write) : Json()},
                    {"subscribed", subscription != nullptr}};
    if (context.json) return context.print(data);
    context.line(fmt::format(
        "{}  {}{}", user,
        !read   ? translated("nothing")
        : write ? translated("read and write")
                : translated("read"),
        read && !own && !lists ? translated("  (the store keeps no access lists: copies are read only)") : ""));
    if (subscription && subscription->isWritable() != write)
        context.say(tr("The last pass found otherwise; `rolvane sync` takes it in."));
}

} // namespace

void addShareCommands(CLI::App& app, Context& context) {
    const auto o = std::make_shared<ShareOptions>();
    const auto common = [o](CLI::App& command, const char* kind) {
        command.add_option("user", o->user, "User name on the store")->required()->type_name(kind);
        command.add_flag("--no-wait", o->noWait, "Return as soon as the daemon is at work");
        command.add_flag("--no-daemon", o->noDaemon, "Only note it; do not start the daemon");
        command.add_option("--timeout", o->timeout, "Seconds to wait for the pass")
            ->check(CLI::PositiveNumber)
            ->capture_default_str();
    };
    addCommand(
        app, context, "share", "Let another user of the store read what you publish, or change it, too",
        [&](CLI::App& command) {
            common(command, kUserValue);
            command.add_flag("--write", o->write, "Changes are allowed; without it reading only");
            declareTrial(command, o->dryRun);
        },
        [&context, o] { changeShares(context, *o, true); });
    addCommand(
        app, context, "unshare", "Take a user's rights back", [&](CLI::App& command) { common(command, kReaderValue); },
        [&context, o] { changeShares(context, *o, false); });
    addCommand(app, context, "shares", "List who may read and who may write, since when, and whether the store agrees",
               nullptr, [&context] { listShares(context); });
    const auto named = std::make_shared<std::string>();
    addCommand(
        app, context, "rights", "Tell what you may do with another user's contacts",
        [&](CLI::App& command) {
            command.add_option("user", *named, "User name or location")->required()->type_name(kUserValue);
        },
        [&context, named] { showRights(context, *named); });
}

} // namespace rolvane::cli
