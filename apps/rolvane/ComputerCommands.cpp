#include "Computers.h"
#include "Consent.h"
#include "FailureText.h"
#include "Invite.h"
#include "LeftOnStore.h"
#include "PassReport.h"
#include "Passes.h"
#include "Publication.h"
#include "PublishedAlready.h"
#include "Shares.h"
#include "Shown.h"
#include "Texts.h"
#include "ValueNames.h"

#include "conduits/PublishedLayout.h"
#include "conduits/TakingIn.h"
#include "conduits/store/ComputersOnStore.h"
#include "conduits/store/StoreComparison.h"
#include "contacts/records/Identifier.h"
#include "contacts/vcard/VCardExport.h"
#include "daemon/DaemonControl.h"
#include "engine/memory/EngineState.h"
#include "foundation/Paths.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <fmt/format.h>
#include <set>
#include <sstream>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

std::vector<std::string> namesIn(const Value& list) {
    std::vector<std::string> names;
    for (const Value& name : list.array()) names.push_back(name.string());
    return names;
}

// join -------------------------------------------------------------------------------------------------------------

struct JoinOptions {
    bool yes = false, dryRun = false;
    double timeout = kPassSeconds;
};

struct Lists {
    std::vector<std::string> readers, writers;
};

// Nothing where the store keeps no access lists: then there is none to be taken.
std::optional<Lists> listsOf(CXDAVManager& store, const Url& base) {
    if (store.keepsAccessLists() == false) return std::nullopt;
    Lists lists;
    if (!store.ACLsAtURL(base, lists.readers, lists.writers))
        throw CommandError(kUnreachable,
                           translated("The store does not show with whom your contacts are shared. Nothing was "
                                      "changed; try again later."));
    return lists;
}

// The counts of a person's own contacts, and of those that are there as well.
struct Meeting {
    size_t peopleHere = 0, groupsHere = 0, peopleThere = 0, groupsThere = 0, peopleOfBoth = 0;
};

Meeting meeting(CXRolvane& database, const OwnTree& tree) {
    const std::set<std::string> there(tree.people.begin(), tree.people.end());
    Meeting found;
    for (const CXListing& person : database.listPeople(RemoteLocation(""))) {
        ++found.peopleHere;
        found.peopleOfBoth += there.contains(cxUIDWithTableName(person.uniqueId, kCXPersonTable).str()) ? 1 : 0;
    }
    found.groupsHere = database.listGroups(RemoteLocation("")).size();
    found.peopleThere = tree.people.size();
    found.groupsThere = tree.groups.size();
    return found;
}

std::string amountHere(const Meeting& of) {
    return amountText(of.peopleHere, of.groupsHere);
}

std::string amountThere(const Meeting& of) {
    return amountText(of.peopleThere, of.groupsThere);
}

std::string joinQuestion(const Meeting& of) {
    std::string text = tr("Join? {} come from the store.", amountThere(of));
    if (of.peopleHere + of.groupsHere == 0) return text;
    text +=
        tr(" The {} of this computer go there as well and are seen by everybody with whom you share", amountHere(of));
    if (of.peopleOfBoth == 1)
        text += translated("; 1 person on both sides becomes as the store has it");
    else if (of.peopleOfBoth > 1)
        text += tr("; {} people on both sides become as the store has them", shownNumber(of.peopleOfBoth));
    return text + translated(". A vCard file of what is here now is kept.");
}

// All that is here now, in a file of its own; "" where there is nothing.
std::string keepCards(CXRolvane& database) {
    std::ostringstream cards;
    if (VCardExport(database, cards, VCardVersion::v4).exportAll() == 0) return {};
    std::string stamp = Clock::system().now().toISO8601();
    std::erase_if(stamp, [](char c) { return c == ':' || c == '-'; });
    const std::string directory = dataDirectory() + "/joined";
    CXPathUtils_MakeCompletePath(directory, 0700);
    const std::string file = fmt::format("{}/{}.vcf", directory, stamp);
    writeFileDurably(file, cards.str());
    return file;
}

void takeRights(CXRolvane& database, const Lists& lists) {
    Shares shares(database);
    for (const std::string& user : shares.readers())
        if (std::find(lists.readers.begin(), lists.readers.end(), user) == lists.readers.end()) shares.deny(user);
    for (const std::string& user : lists.readers)
        shares.grant(user, std::find(lists.writers.begin(), lists.writers.end(), user) != lists.writers.end());
}

// Has all of the tree come, and what was here gone there? The daemon notes what it has taken in.
bool isTakenIn(Preferences& preferences) {
    EngineState state(preferences);
    const Dictionary users = state.conduitObjectForKey(kConduitVaultra, kPriorState);
    return state.conduitObjectForKey(kConduitCX, kTakingIn)[kSelf.str()].string().empty() &&
           users[kSelf.str()].dictionary()[kSerialNumber].isString();
}

// A list of everybody that names nobody, beside groups that do, is the list of groups published by themselves. Where
// they have no members either, the file of computers tells: `rolvane publish` makes one with the whole list alone.
bool holdsSingleGroups(CXDAVManager& store, const Url& base, const OwnTree& tree) {
    if (!tree.hasList || !tree.people.empty() || tree.groups.empty()) return false;
    const auto hasMembers = [&](const std::string& group) {
        const auto state = store.dictionaryAtURL(layout::groupLocation(base, UniqueId(group)), true, nullptr);
        return state && !(*state)[kMemberUIDState].array().empty();
    };
    return tree.computers.empty() || std::any_of(tree.groups.begin(), tree.groups.end(), hasMembers);
}

OwnTree requireTree(CXDAVManager& store) {
    OwnTree tree = lookAtOwnTree(store);
    if (tree.serial.empty())
        throw CommandError(kNotFound,
                           translated("Nothing of this account is published on its store. Publish on the other "
                                      "computer first, with `rolvane publish`. Nothing was changed."));
    if (!tree.hasList)
        throw CommandError(kRefused,
                           translated("What is published of this account has no list of its contacts, or it cannot be "
                                      "read just now. The computer that published it mends that: run `rolvane sync` "
                                      "there. Nothing was changed."));
    if (tree.singleGroups)
        throw CommandError(kRefused,
                           translated("Single groups are published of this account, and one computer alone keeps those "
                                      "in step. Publish the whole list on the other computer first, with `rolvane "
                                      "publish`; or stay without. Nothing was changed."));
    return tree;
}

// True: this computer has published the tree itself, or has joined it.
bool keepsItAlready(CXRolvane& database, CXDAVManager& store) {
    const Publication publication(database);
    if (!publication.groups().empty())
        throw CommandError(kRefused,
                           translated("Single groups are published from this computer. Withdraw them first with "
                                      "`rolvane unpublish`. Nothing was changed."));
    if (!publication.everything()) return false;
    if (publishedAlready(store, Preferences::shared(), true).by == PublishedAlready::By::thisComputer) return true;
    throw CommandError(
        kRefused, translated("Contacts are published from this computer as another publication than the one on "
                             "the store. `rolvane unpublish --keep` ends it here; then join. Nothing was changed."));
}

void restartDaemon() {
    const DaemonControl daemon;
    daemon.running() ? daemon.restart() : (void)daemon.start();
}

void join(Context& context, const JoinOptions& options) {
    const Url base = ownBase();
    requireStore(context, translated("Nothing was changed."));
    CXDAVManager& store = CXDAVManager::defaultManager();
    CXRolvane& database = context.database();
    Preferences& preferences = Preferences::shared();
    if (LeftOnStore(database, preferences, base).anything())
        throw CommandError(kRefused,
                           translated("A withdrawal has not come to its end. Run `rolvane unpublish` again first. "
                                      "Nothing was changed."));
    const OwnTree tree = requireTree(store);
    if (keepsItAlready(database, store)) {
        if (!isOneOfSeveral(preferences)) {
            DaemonControl().stop();
            becomeOneOfSeveral(preferences);
            restartDaemon();
        }
        context.say(translated("This computer keeps this publication in step already."));
        return;
    }
    const std::optional<Lists> lists = listsOf(store, base);
    const Meeting met = meeting(database, tree);
    if (options.dryRun) {
        if (context.json)
            context.print(Json{{"dryRun", true},
                               {"peopleHere", met.peopleHere},
                               {"groupsHere", met.groupsHere},
                               {"peopleThere", met.peopleThere},
                               {"groupsThere", met.groupsThere},
                               {"peopleOfBoth", met.peopleOfBoth}});
        context.say(tr("{} would come, and {} of this computer would go there; {} on both sides. Nothing was "
                       "changed: this was a trial.",
                       amountThere(met), amountHere(met), countedText(met.peopleOfBoth, "person is", "people are")));
        return;
    }
    requireConsent(context, options.yes, joinQuestion(met), translated("Nothing was changed."));

    const DaemonControl daemon;
    const bool ran = daemon.stop();
    std::string kept;
    try {
        kept = keepCards(database);
        // In this order: a daemon that starts in between finds nothing published, or takes everything in.
        becomeOneOfSeveral(preferences);
        forgetPublication(preferences);
        if (lists) takeRights(database, *lists);
        Publication(database).publishEverything(base);
        database.save();
    } catch (const CXException&) {
        if (ran) daemon.start();
        throw;
    }
    if (!kept.empty()) context.say(tr("What was here before is kept in {}.", kept));
    PassWatch watch(context, !context.quiet);
    OutcomeWatch outcomes(context);
    daemon.start();
    PassOutcome outcome =
        waitForPass(context, watch, outcomes, translated("Joining"), database.journalPosition(), options.timeout);
    constexpr int kMostPasses = 5;
    for (int passes = 0; passes < kMostPasses && !isTakenIn(preferences) && outcome.storeReached; ++passes)
        outcome = makePass(context, options.timeout);
    const bool well = report(context, outcome, {});
    const bool done = isTakenIn(preferences);
    if (context.json)
        context.print(Json{{"joined", done},
                           {"people", database.countPeople(RemoteLocation(""))},
                           {"groups", database.listGroups(RemoteLocation("")).size()},
                           {"kept", kept.empty() ? Json() : Json(kept)},
                           {"pass", outcomeJson(outcome)}});
    if (!done) {
        context.warn(translated("Not all of it has come yet. Nothing of this computer goes to the store before it has; "
                                "`rolvane sync` goes on."));
        if (well) context.exitCode = kFailed;
        return;
    }
    context.say(
        tr("This computer is in step with the others: {} are here.",
           amountText(database.countPeople(RemoteLocation("")), database.listGroups(RemoteLocation("")).size())));
}

// computers --------------------------------------------------------------------------------------------------------

void rename(Context& context, const std::string& name) {
    Preferences& preferences = Preferences::shared();
    preferences.set(kDaemonDomain, kCXDComputerName, name);
    preferences.remove(kDaemonDomain, kCXDToldOfItself); // the next pass tells the name
    preferences.synchronize(kDaemonDomain);
    context.say(tr("This computer is called \"{}\" from its next pass on.", name));
}

void listComputers(Context& context) {
    (void)ownBase();
    Preferences& preferences = Preferences::shared();
    std::vector<Computer> all = computersOfValue(preferences.get(kDaemonDomain, kCXDComputers));
    if (const auto failure = testStore())
        context.warn(tr("The store cannot be asked just now. {} These are the computers as they were seen "
                        "last.",
                        failureText(*failure, sceneOfTheAccount(Clock::system().now())).what));
    else
        all = lookAtOwnTree(CXDAVManager::defaultManager()).computers;
    if (context.json) return context.print(computersJson(preferences, all));
    const std::string self = thisComputer(preferences).id;
    for (const Computer& each : all)
        context.line(fmt::format("{}  {}{}", each.name,
                                 each.seen ? tr("last there {}", shownDate(*each.seen)) : translated("published"),
                                 each.id == self ? translated("  (this computer)") : ""));
    if (all.empty())
        context.say(
            translated("No computer has told of itself. `rolvane publish` does so on the first one, `rolvane join` on "
                       "each further one."));
}

// leave ------------------------------------------------------------------------------------------------------------

struct LeaveOptions {
    std::string computer;
    bool yes = false;
};

void forgetOther(Context& context, const std::string& name) {
    requireStore(context, translated("Nothing was changed."));
    CXDAVManager& store = CXDAVManager::defaultManager();
    Preferences& preferences = Preferences::shared();
    const std::string self = thisComputer(preferences).id;
    std::vector<Computer> all = lookAtOwnTree(store).computers;
    std::erase_if(all, [&](const Computer& each) { return each.id == self || (each.name != name && each.id != name); });
    if (all.empty()) throw CommandError(kNotFound, tr("No other computer is called \"{}\".", name));
    if (all.size() > 1)
        throw CommandError(kNotFound, tr("{} computers are called \"{}\". `rolvane computers --json` tells "
                                         "their identifiers, which name one of them.",
                                         all.size(), name));
    ComputersOnStore onStore(store, ownBase());
    if (!onStore.remove(all.front().id))
        throw CommandError(kUnreachable, translated("The list of computers could not be written. Try again later."));
    const auto left = onStore.read();
    if (left && std::all_of(left->begin(), left->end(), [&](const Computer& each) { return each.id == self; }))
        becomeTheOnlyOne(preferences);
    context.say(tr("\"{}\" is no longer listed. Should it still run, its next pass lists it again.", name));
}

void leave(Context& context, const LeaveOptions& options) {
    const Url base = ownBase();
    if (!options.computer.empty()) return forgetOther(context, options.computer);
    CXRolvane& database = context.database();
    Preferences& preferences = Preferences::shared();
    if (!isOneOfSeveral(preferences))
        throw CommandError(kRefused,
                           translated("This computer keeps its contacts in step with no other one. `rolvane unpublish` "
                                      "takes them off the store."));
    if (otherComputers(preferences).empty())
        throw CommandError(
            kRefused, translated("No other computer keeps these contacts on the store in step. `rolvane unpublish` "
                                 "takes them off the store."));
    requireConsent(context, options.yes,
                   tr("Leave? The contacts stay here and on the store; what is changed here from now on does "
                      "not go to {}, nor to anybody with whom you share.",
                      computersText(otherComputers(preferences))),
                   translated("Nothing was changed."));
    const DaemonControl daemon;
    const bool ran = daemon.stop();
    try {
        Publication(database).withdrawEverything();
        database.save();
        forgetPublication(preferences);
        becomeTheOnlyOne(preferences);
    } catch (const CXException&) {
        if (ran) daemon.start();
        throw;
    }
    CXDAVManager& store = CXDAVManager::defaultManager();
    store.mendOwnTreeOnly(true);
    if (testStore() || !ComputersOnStore(store, base).remove(thisComputer(preferences).id))
        context.warn(
            translated("The store could not be told: the other computers go on listing this one. `rolvane leave "
                       "--computer NAME` takes it off their list."));
    if (ran) daemon.start();
    context.say(tr("This computer keeps its {} to itself from now on.",
                   countedText(database.countPeople(RemoteLocation("")), "person", "people")));
}

} // namespace

// shared with other commands ----------------------------------------------------------------------------------------

std::vector<Computer> otherComputers(Preferences& preferences) {
    std::vector<Computer> all = computersOfValue(preferences.get(kDaemonDomain, kCXDComputers));
    if (all.empty()) return all;
    std::erase_if(all, [self = thisComputer(preferences).id](const Computer& each) { return each.id == self; });
    return all;
}

std::string computerText(const Computer& computer) {
    return fmt::format("\"{}\"{}", computer.name,
                       computer.seen ? tr(" (last there {})", shownDate(*computer.seen)) : "");
}

std::string computersText(const std::vector<Computer>& computers) {
    if (computers.empty()) return translated("another computer");
    std::string text;
    for (size_t i = 0; i < computers.size(); ++i)
        text += (i == 0 ? "" : i + 1 < computers.size() ? ", " : translated(" and ")) + computerText(computers[i]);
    return text;
}

nlohmann::ordered_json computersJson(Preferences& preferences, const std::vector<Computer>& computers) {
    Json all = Json::array();
    if (computers.empty()) return all;
    const std::string self = thisComputer(preferences).id;
    for (const Computer& each : computers)
        all.push_back({{"id", each.id},
                       {"name", each.name},
                       {"thisComputer", each.id == self},
                       {"lastThere", each.seen ? Json(each.seen->toISO8601()) : Json()}});
    return all;
}

OwnTree lookAtOwnTree(CXDAVManager& store) {
    const Url base = store.account().baseLocationFor(store.account().user);
    store.mendOwnTreeOnly(true);
    OwnTree tree;
    const bool isThere = store.sanityCheckPublishStructureCreate(false) ||
                         store.modDateForURL(base.cxURLByAppendingComponent(layout::kInfo));
    if (!isThere) return tree;
    const auto info = store.dictionaryAtURL(base.cxURLByAppendingComponent(layout::kInfo), true, nullptr);
    if (!info) return tree;
    tree.serial = (*info)[kSerialNumber].string();
    if (const auto list =
            store.dictionaryAtURL(layout::groupLocation(base, UniqueId(layout::kAllGroup)), true, nullptr)) {
        tree.hasList = (*list)[kMemberUIDState].isArray();
        tree.people = namesIn((*list)[kMemberUIDState]);
        tree.groups = namesIn((*list)[kSubgroupUIDState]);
    }
    if (const auto computers = ComputersOnStore(store, base).read()) tree.computers = *computers;
    tree.singleGroups = holdsSingleGroups(store, base, tree);
    return tree;
}

// Where the tree names nobody, an earlier version may have published it: the number that this computer knew its own one
// by tells.
void requireOwnTree(CXDAVManager& store, Preferences& preferences) {
    OwnTree tree = lookAtOwnTree(store);
    if (tree.serial.empty() || (tree.people.empty() && tree.groups.empty())) return;
    const std::string self = thisComputer(preferences).id;
    const bool namesUs = std::any_of(tree.computers.begin(), tree.computers.end(),
                                     [&](const Computer& each) { return each.id == self; });
    std::erase_if(tree.computers, [&](const Computer& each) { return each.id == self; });
    const bool wasOurs = tree.serial == preferences.get(kDaemonDomain, kCXDFormerTree).string();
    if (tree.computers.empty() && (namesUs || wasOurs)) return;
    throw CommandError(kRefused,
                       tr("{} and {} of this account are published already, from {}. `rolvane join` brings "
                          "them here and keeps both in step; `rolvane publish --replace` publishes over them. "
                          "Nothing was published.",
                          countedText(tree.people.size(), "person", "people"),
                          countedText(tree.groups.size(), "group", "groups"), computersText(tree.computers)));
}

// The store knows of one that joined a moment ago. Where it cannot be asked, what the daemon saw last counts.
void requireNoOtherComputer(CXDAVManager& store, Preferences& preferences) {
    std::vector<Computer> others = otherComputers(preferences);
    bool may = isOneOfSeveral(preferences) && (!preferences.get(kDaemonDomain, kCXDComputers) || !others.empty());
    if (!testStore())
        if (auto listed = ComputersOnStore(store, ownBase()).read()) {
            std::erase_if(*listed,
                          [self = thisComputer(preferences).id](const Computer& each) { return each.id == self; });
            may = !listed->empty();
            others = *listed;
        }
    if (!may) return;
    throw CommandError(kRefused,
                       tr("These contacts are kept in step with {}, and would leave the store for all of them. "
                          "`rolvane leave` takes this computer out alone; `rolvane unpublish --all-computers` "
                          "takes them off the store; `rolvane leave --computer NAME` forgets one that is gone. "
                          "Everything is still published.",
                          computersText(others)));
}

void noteThisComputer(CXDAVManager& store, Preferences& preferences) {
    Computer self = thisComputer(preferences);
    self.seen = Clock::system().now();
    ComputersOnStore(store, store.account().baseLocationFor(store.account().user)).put(self);
}

void addComputerCommands(CLI::App& app, Context& context) {
    const auto joining = std::make_shared<JoinOptions>();
    addCommand(
        app, context, "join", "Bring what another computer of yours has published here, and keep both in step",
        [&](CLI::App& command) {
            declareConsent(command, joining->yes);
            declareTrial(command, joining->dryRun);
            command.add_option("--timeout", joining->timeout, "Seconds to wait for the pass")
                ->check(CLI::PositiveNumber)
                ->capture_default_str();
        },
        [&context, joining] { join(context, *joining); });
    struct ListOptions {
        std::string name;
        bool invite = false, qr = false;
    };
    const auto listing = std::make_shared<ListOptions>();
    addCommand(
        app, context, "computers", "List the computers that keep your contacts in step, and when each was last there",
        [&](CLI::App& command) {
            const auto name = command.add_option("--name", listing->name, "Call this computer so");
            const auto invite = command.add_flag("--invite", listing->invite,
                                                 "Print a line that sets up the account on a further computer of "
                                                 "yours; the password is in it");
            invite->excludes(name);
            command.add_flag("--qr", listing->qr, "Show that line as a QR code, too")->needs(invite);
        },
        [&context, listing] {
            if (listing->invite) return inviteOwnComputer(context, listing->qr);
            listing->name.empty() ? listComputers(context) : rename(context, listing->name);
        });
    const auto leaving = std::make_shared<LeaveOptions>();
    addCommand(
        app, context, "leave", "Keep this computer out of step from now on; the contacts stay here and on the store",
        [&](CLI::App& command) {
            command.add_option("--computer", leaving->computer, "Take another one, which is lost, off the list")
                ->type_name(kComputerValue);
            declareConsent(command, leaving->yes);
        },
        [&context, leaving] { leave(context, *leaving); });
}

} // namespace rolvane::cli
