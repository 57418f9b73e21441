#include "Books.h"
#include "Computers.h"
#include "Conflicts.h"
#include "Context.h"
#include "FailureText.h"
#include "LeftOnStore.h"
#include "PassReport.h"
#include "PassWatch.h"
#include "Publication.h"
#include "SafeText.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "Withdrawn.h"

#include "conduits/store/ComputersOnStore.h"
#include "conduits/store/EndedPublication.h"
#include "daemon/DaemonControl.h"
#include "engine/memory/EngineState.h"
#include "engine/pass/PassOutcome.h"
#include "engine/recovery/DatabaseCare.h"
#include "store/dav/CXDAVManager.h"

#include <csignal>
#include <fmt/format.h>
#include <iostream>
#include <set>
#include <sys/signalfd.h>
#include <unistd.h>
#include <utility>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

void daemonStart(Context& context) {
    const DaemonControl daemon;
    const bool started = daemon.start();
    context.say(started ? translated("RolvaneManager is at work.")
                        : tr("RolvaneManager runs already (process {}).", daemon.running().value_or(0)));
}

void daemonStop(Context& context) {
    context.say(DaemonControl().stop() ? translated("RolvaneManager has ended.")
                                       : translated("RolvaneManager was not running."));
}

// Exit code 0 when it runs, 3 when it does not.
void daemonStatus(Context& context) {
    const auto pid = DaemonControl().running();
    if (context.json)
        context.print({{"running", pid.has_value()}, {"process", pid ? Json(*pid) : Json()}});
    else
        context.line(pid ? tr("RolvaneManager runs (process {}).", *pid)
                         : translated("RolvaneManager is not running."));
    if (!pid) context.exitCode = kNotFound;
}

Json dateOrNull(const Value& value) {
    return value.date() ? Json(value.date()->toISO8601()) : Json();
}

Json textOrNull(const Value& value) {
    return value.isString() ? Json(value.string()) : Json();
}

Json storeStatus() {
    const CXDAVAccount& account = CXDAVManager::defaultManager().account();
    if (account.user.empty()) return Json();
    const auto failure = testStore();
    const FailureScene scene = sceneOfTheAccount(Clock::system().now());
    const Json told = failure ? failureJson(*failure, scene) : Json();
    return {{"user", account.user.str()},
            {"endpoint", account.endpoint},
            {"location", CXDAVManager::ostrelBaseLocationForOstrelUser(account.user).absoluteString()},
            {"reachable", !failure},
            {"reason", failure ? told["what"] : Json()},
            {"toDo", failure ? told["toDo"] : Json()}};
}

// Records that were changed since the daemon looked at the database last. More than so many are not counted.
size_t editsNotLookedAt(CXRolvane& database) {
    constexpr size_t kMost = 1000;
    const int64_t cursor = database.cursorPosition("RolvaneManager");
    if (cursor < 0) return 0; // it scans the whole database when it comes
    std::set<UniqueId> records;
    for (const CXJournalEntry& entry : database.journalEntries(cursor, kMost))
        if (entry.program != "RolvaneManager") records.insert(entry.uniqueId);
    return records.size();
}

int64_t waitingIn(const std::optional<PassOutcome>& outcome) {
    int64_t waiting = 0;
    if (outcome)
        for (const PassTree& tree : outcome->trees) waiting += tree.out.waiting + tree.in.waiting;
    return waiting;
}

Json refusedJson(const Preferences& preferences) {
    Json all = Json::array();
    const Array notes = preferences.get(kDaemonDomain, kCXDRefusedChanges).array();
    for (const Value& value : notes) {
        const Dictionary note = value.dictionary();
        const std::string& why = note[kRefusedWhy].string();
        all.push_back({{"user", note[kRefusedUser].string()},
                       {"why", why.empty() ? "right" : why},
                       {"group", note.contains(kRefusedGroup) ? Json(note[kRefusedGroup].string()) : Json()},
                       {"changes", note[kRefusedChanges].integer()},
                       {"date", dateOrNull(note[kRefusedDate])}});
    }
    return all;
}

std::string refusalReason(const Json& record) {
    const std::string user = record["user"];
    if (record["why"] == kRefusedAsGroupIsGone) {
        const std::string group = record["group"].is_null()
                                      ? std::string(translated("the group"))
                                      : tr("the group \"{}\"", record["group"].get<std::string>());
        return tr("{} has deleted {} meanwhile, so what you changed in it was given up. Make another group "
                  "to keep its people together.",
                  user == kSelf.str() ? translated("somebody else who may write") : user, group);
    }
    if (record["why"] == kRefusedForItsName)
        return translated("the store keeps files of its own under that identifier. The change stays in this database.");
    if (record["why"] == kRefusedByOwnStore)
        return translated("the store does not let you write in your own tree. Nothing of it is lost here, and it is "
                          "sent again until the store takes it. Ask the store's administrator to let you write there.");
    const std::string advice =
        user == kSelf.str()
            ? std::string(translated("Have the store's administrator let you write in your tree, then edit again."))
            : tr("Ask {} for `rolvane share {} --write`, then edit again.", user, CXDAVManager::vaultraUser());
    return tr("the store does not let you write there. {}", advice);
}

std::string refusedText(const Json& record) {
    const int64_t changes = record["changes"];
    const std::string user = record["user"];
    return tr("{}, {}, on {}: {}", user == kSelf.str() ? translated("your own contacts") : tr("{}'s contacts", user),
              countedText(changes, "change", "changes"),
              record["date"].is_null() ? translated("an unknown date") : shownDate(record["date"].get<std::string>()),
              refusalReason(record));
}

// Of no interest once something is published again.
Json endedJson(const Preferences& preferences, bool publishes) {
    const auto ended = endedPublication(preferences);
    if (!ended || publishes) return nullptr;
    Json users = Json::array();
    for (const UserName& user : ended->mayStillRead) users.push_back(user.str());
    return {{"date", ended->when.toISO8601()},
            {"why", ended->hadOthers  ? "withdrawnElsewhere"
                    : ended->replaced ? "replaced"
                                      : "goneOrForbidden"},
            {"mayStillRead", users}};
}

std::string endedText(const Json& ended) {
    std::string users;
    for (const Json& user : ended["mayStillRead"]) users += (users.empty() ? "" : ", ") + user.get<std::string>();
    return tr(
        "on {}: {}. `rolvane publish` publishes again.{}", shownDate(ended["date"].get<std::string>()),
        ended["why"] == "withdrawnElsewhere"
            ? translated("another computer of yours has taken it off the store, or has published it anew; `rolvane "
                         "join` keeps this one in step with a new one")
        : ended["why"] == "replaced"
            ? translated("another publication of yours lies in its place on the store, made from another "
                         "computer perhaps")
            : translated("the store has nothing of it any more, or does not let you in"),
        users.empty() ? ""
                      : tr(" The store does not know yet that you took rights away from {}: after `rolvane "
                           "publish`, `rolvane unshare` takes them away there.",
                           users));
}

Json status(Context& context) {
    CXRolvane& database = context.database();
    Preferences& preferences = Preferences::shared();
    Publication publication(database);
    Json groups = Json::array(), subscriptions = Json::array();
    for (const CXGroupRef& group : publication.groups())
        groups.push_back({{"identifier", group->uniqueId().str()}, {"name", group->name()}});
    for (const CXSubscriptionRef& s : subscriptionsToPeople(database))
        subscriptions.push_back({{"user", publisherOf(s->remoteLocation())},
                                 {"location", s->remoteLocation().str()},
                                 {"writable", s->isWritable()}});
    const auto pid = DaemonControl().running();
    auto outcome = lastOutcome(preferences);
    if (outcome) // without what has been withdrawn, or is subscribed to no more, since
        std::erase_if(outcome->trees, [&](const PassTree& tree) {
            if (tree.ended) return false;
            if (tree.user == kSelf) return !publication.anything();
            return !database.findSubscriptionWithRemoteLocation(RemoteLocation(tree.location));
        });
    const bool shares = publication.anything() || !subscriptions.empty();
    return {{"people", database.countPeople(RemoteLocation(""))},
            {"groups", database.listGroups(RemoteLocation("")).size()},
            {"damaged", textOrNull(preferences.get(kDaemonDomain, kCXDDamagedDatabase))},
            {"daemon", pid ? Json(*pid) : Json()},
            {"store", storeStatus()},
            {"published", {{"everything", publication.everything()}, {"groups", groups}}},
            {"computers", computersJson(preferences, computersOfValue(preferences.get(kDaemonDomain, kCXDComputers)))},
            {"publicationEnded", endedJson(preferences, publication.anything())},
            {"leftOnStore", anythingLeftOnStore(database, preferences)},
            {"subscriptions", subscriptions},
            {"books", booksJson()},
            {"withdrawn", withdrawnJson()},
            {"refused", refusedJson(preferences)},
            {"conflicts", conflictsJson(database)},
            {"pending", waitingIn(outcome)},
            {"notLookedAt", shares ? editsNotLookedAt(database) : 0},
            {"lastPass", outcome ? Json(outcome->ended.toISO8601()) : Json()},
            {"pass", outcomeJson(outcome)}};
}

std::string publishedText(const Json& published) {
    if (published["everything"].get<bool>()) return translated("the whole contact list");
    if (published["groups"].empty()) return translated("nothing");
    std::string names;
    for (const Json& group : published["groups"])
        names += (names.empty() ? "" : ", ") + group["name"].get<std::string>();
    return published["groups"].size() == 1 ? tr("the group {}", names) : tr("the groups {}", names);
}

std::string subscribedText(const Json& subscriptions) {
    std::string text;
    for (const Json& s : subscriptions)
        text += (text.empty() ? "" : ", ") + s["user"].get<std::string>() +
                (s["writable"].get<bool>() ? translated(" (read and write)") : "");
    return text.empty() ? translated("to nobody") : tr("to {}", text);
}

std::string inStep(bool own, const std::string& when) {
    return own ? tr("sent {}", when) : tr("read {}", when);
}

// When the tree was last as it should be, and since when it is not.
std::string inStepText(const Json& tree) {
    const bool own = tree["own"];
    const Json& direction = tree[own ? "out" : "in"];
    const auto date = [&](const char* key) {
        return direction[key].is_null() ? std::string() : shownDate(direction[key].get<std::string>());
    };
    const std::string last = date("inStep"), since = date("waitingSince");
    return (own ? translated("your own contacts") : tr("{}'s contacts", tree["user"].get<std::string>())) + ": " +
           inStep(own, last.empty() ? translated("never") : last) +
           (since.empty() ? "" : tr(", what came after that waits since {}", since));
}

std::string computerRow(const Json& computer) {
    return computer["name"].get<std::string>() +
           (computer["thisComputer"].get<bool>() ? translated(" (this one)") : "") +
           (computer["lastThere"].is_null()
                ? ""
                : tr(", last there {}", shownDate(computer["lastThere"].get<std::string>())));
}

// Has a daemon anything to do?
bool needsDaemon(const Json& s) {
    const Json& published = s["published"];
    return published["everything"].get<bool>() || !published["groups"].empty() || !s["subscriptions"].empty() ||
           !s["books"].is_null() || s["leftOnStore"].get<bool>() || s["pending"].get<size_t>() > 0;
}

std::string daemonText(const Json& s) {
    if (!s["daemon"].is_null()) return tr("running, process {}", s["daemon"].get<int>());
    return needsDaemon(s) ? translated("not running (`rolvane daemon start`)")
                          : translated("not running, and nothing is shared that it would keep in step");
}

void showStatus(Context& context) {
    const Json s = status(context);
    if (!s["damaged"].is_null()) context.exitCode = kFailed;
    if (context.json) return context.print(s);
    const auto row = [&](const std::string& label, const std::string& text) { context.row(label, text); };
    const size_t people = s["people"], groups = s["groups"], pending = s["pending"];
    row(translated("Contacts"),
        countedText(people, "person", "people") + ", " + countedText(groups, "group", "groups"));
    if (!s["damaged"].is_null()) row(translated("Database"), s["damaged"].get<std::string>());
    row(translated("Daemon"), daemonText(s));
    if (s["store"].is_null()) {
        row(translated("Store"), translated("no account yet (`rolvane setup`)"));
    } else {
        const Json& store = s["store"];
        row(translated("Store"),
            tr("{} at {}", store["user"].get<std::string>(), store["endpoint"].get<std::string>()));
        row("", store["reachable"].get<bool>() ? translated("can be reached") : store["reason"].get<std::string>());
        if (!store["reachable"].get<bool>()) row("", store["toDo"].get<std::string>());
    }
    row(translated("Published"), publishedText(s["published"]));
    if (s["computers"].size() > 1) {
        std::string label = translated("Computers");
        for (const Json& computer : s["computers"]) row(std::exchange(label, ""), computerRow(computer));
    }
    if (!s["publicationEnded"].is_null()) row("", tr("ended {}", endedText(s["publicationEnded"])));
    if (s["leftOnStore"])
        row("", translated("files of what was withdrawn are still on the store; the same `rolvane unpublish` again "
                           "removes them"));
    row(translated("Subscribed"), subscribedText(s["subscriptions"]));
    if (!s["books"].is_null()) {
        row(translated("Address books"), booksText(s["books"]));
        for (const Json& link : s["books"]["links"]) row(translated("Linked"), linkText(link));
    }
    for (const Json& record : s["withdrawn"]) row(translated("Withdrawn"), withdrawnText(record));
    for (const Json& record : s["refused"]) row(translated("Refused"), refusedText(record));
    for (const Json& conflict : s["conflicts"])
        row(translated("Conflict"), tr("{}; `rolvane conflicts restore {}` puts it back", conflictText(conflict),
                                       conflict["number"].get<int64_t>()));
    row(translated("Waiting"), countedText(pending, "change", "changes"));
    if (const size_t edited = s["notLookedAt"]; edited > 0)
        row("", tr("{} edited since the daemon looked last{}", countedText(edited, "record was", "records were"),
                   s["daemon"].is_null() ? translated("; it is not running") : ""));
    if (s["pass"].is_null()) return row(translated("Last pass"), translated("never"));
    std::string label = translated("In step");
    for (const Json& tree : s["pass"]["trees"]) row(std::exchange(label, ""), inStepText(tree));
    row(translated("Last pass"), shownDate(s["lastPass"].get<std::string>()));
    for (const Json& message : s["pass"]["messages"]) row("", message.get<std::string>());
}

// The terminal's end of a watch: interrupt and termination end it in order.
class Interrupt {
public:
    explicit Interrupt(RunLoop& loop) {
        sigset_t set;
        sigemptyset(&set);
        sigaddset(&set, SIGINT);
        sigaddset(&set, SIGTERM);
        sigprocmask(SIG_BLOCK, &set, nullptr);
        _fd = ::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
        _source = loop.addPort(_fd, [this](uint32_t) { _came = true; });
    }
    ~Interrupt() {
        _source.reset();
        ::close(_fd);
    }
    bool came() const { return _came; }

private:
    int _fd = -1;
    bool _came = false;
    RunLoop::Handle _source;
};

struct WatchOptions {
    bool once = false;
    double seconds = 0; // 0: until it is interrupted
};

void tellEnd(Context& context, const PassOutcome& outcome) {
    if (context.json) return context.line(Json{{"event", "ended"}, {"pass", outcomeJson(outcome)}}.dump());
    const PassReport told = reportOf(outcome, !outcome.full);
    for (const std::string& line : told.lines) context.line(line);
    if (told.lines.empty())
        context.line(outcome.full ? translated("Everything is up to date.")
                                  : translated("Everything is on the store."));
}

void watch(Context& context, const WatchOptions& options) {
    PassWatch pass(context);
    const bool runs = DaemonControl().running().has_value();
    if (!runs && options.seconds <= 0)
        context.say(
            translated("RolvaneManager is not running; it is shown once it does. `rolvane daemon start` starts it."));
    Interrupt interrupt(context.loop());
    std::unique_ptr<ProgressBar> bar;
    const bool draw = context.dataIsTerminal() && context.talkIsTerminal() && !context.json;
    pass.onEvent = [&](const PassWatch::Event& event) {
        using Kind = PassWatch::Event::Kind;
        if (context.json) {
            Json data{{"event", event.kind == Kind::started    ? "started"
                                : event.kind == Kind::progress ? "progress"
                                                               : "stopped"}};
            if (event.kind == Kind::progress) {
                data["location"] = event.location;
                data["fraction"] = event.fraction;
            }
            context.line(data.dump());
        } else if (event.kind == Kind::progress && draw) {
            if (!bar) bar = std::make_unique<ProgressBar>(context, translated("Synchronising"));
            bar->update(event.fraction, event.location);
        } else {
            bar.reset();
            if (event.kind == Kind::started) context.line(translated("started"));
            if (event.kind == Kind::stopped) context.line(translated("stopped"));
            if (event.kind == Kind::progress)
                context.line(fmt::format("{} {:.1f}%", event.location, event.fraction * 100));
        }
        std::fflush(stdout);
        std::cout.flush();
    };
    std::optional<PassOutcome> outcome;
    const ObservationHandle ended = context.bus().observe(
        kCXDPassEndedNotification,
        [&](const Notification& notification) {
            const auto heard = decodeOutcome(notification.userInfo);
            if (!heard) return;
            outcome = heard;
            bar.reset();
            tellEnd(context, *outcome);
            std::cout.flush();
        },
        false);
    if (context.json) {
        context.line(Json{{"event", "watching"}}.dump()); // from here on nothing is missed
        std::cout.flush();
    }
    constexpr double kForever = 1e9;
    const bool inTime = pass.waitUntil([&] { return interrupt.came() || (options.once && outcome); },
                                       options.seconds > 0 ? options.seconds : kForever);
    if (options.once && outcome) context.exitCode = reportOf(*outcome, !outcome->full).code;
    if (!inTime && options.once)
        throw CommandError(kUnreachable, tr("No pass ended within {} seconds.{}", options.seconds,
                                            runs ? ""
                                                 : translated(" RolvaneManager is not running; `rolvane daemon "
                                                              "start` starts it.")));
}

} // namespace

void addDaemonCommands(CLI::App& app, Context& context) {
    CLI::App* daemon = addCommand(app, context, "daemon", "Start, stop and find the daemon", nullptr, nullptr);
    daemon->require_subcommand(1);
    addCommand(*daemon, context, "start", "Start it, unless it runs", nullptr, [&context] { daemonStart(context); });
    addCommand(*daemon, context, "stop", "End it; what waits is kept", nullptr, [&context] { daemonStop(context); });
    addCommand(*daemon, context, "restart", "End it if it runs, and start it", nullptr, [&context] {
        DaemonControl().restart();
        context.say(translated("RolvaneManager is at work."));
    });
    addCommand(*daemon, context, "status", "Tell whether it runs (exit code 0 or 3)", nullptr,
               [&context] { daemonStatus(context); });
    addCommand(app, context, "status", "Tell what is shared, what waits, and what was withdrawn, refused or given up",
               nullptr, [&context] { showStatus(context); });
    const auto options = std::make_shared<WatchOptions>();
    addCommand(
        app, context, "watch", "Show the daemon's progress as it comes",
        [&](CLI::App& command) {
            command.add_flag("--once", options->once, "End with the first pass that ends, and with its exit code");
            command.add_option("--seconds", options->seconds, "End after so many seconds")->check(CLI::PositiveNumber);
        },
        [&context, options] { watch(context, *options); });
}

} // namespace rolvane::cli
