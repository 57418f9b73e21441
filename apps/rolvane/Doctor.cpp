#include "Doctor.h"

#include "AccountTrial.h"
#include "FailureText.h"
#include "Publication.h"
#include "PublishedAlready.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "UnitState.h"

#include "contacts/database/DamagedDatabase.h"
#include "daemon/DaemonControl.h"
#include "engine/pass/PassOutcome.h"
#include "engine/recovery/DatabaseCare.h"
#include "foundation/BusConnection.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "store/account/CertificateChain.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <cmath>
#include <fmt/format.h>
#include <sys/statvfs.h>
#include <unistd.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;
using State = Finding::State;

constexpr double kDay = 24 * 3600;
constexpr double kClockSeconds = 120;                             // further apart, dates of edits mislead
constexpr double kSoonDays = 30;                                  // an authority's end to be told before
constexpr uint64_t kLittleRoom = 100u << 20, kNoRoom = 10u << 20; // bytes

int64_t wholeDays(double seconds) {
    return static_cast<int64_t>(std::floor(seconds / kDay));
}

Date now() {
    return Clock::system().now();
}

} // namespace

const char* stateName(State state) {
    switch (state) {
    case State::well: return "well";
    case State::note: return "note";
    case State::failed: return "failed";
    case State::unknown: break;
    }
    return "unknown";
}

void Doctor::attempt(const std::string& check, const std::string& command, const std::function<Finding()>& look) {
    try {
        add(look());
    } catch (const CXException& error) {
        // Damaged preferences are one failure, whoever else needs them.
        const bool isElsewhere = error.name() == kCXPreferencesException && check != "preferences";
        if (isElsewhere)
            add({check, State::unknown, translated("The preferences cannot be read."), "", Json::object()});
        else
            add({check, State::failed, error.reason(), command, Json::object()});
    }
}

std::vector<Finding> Doctor::examine() {
    examineFiles();
    examineStore();
    examineSystem();
    return std::move(_found);
}

// The files here -----------------------------------------------------------------------------------------------------

void Doctor::examineFiles() {
    attempt("database", "rolvane status", [this] { return database(); });
    const std::string file = stateDirectory() + "/preferences.db";
    attempt("preferences", fmt::format("mv '{0}' '{0}.damaged'", file), [this] { return preferences(); });
    attempt("disk", "df -h ~", [this] { return disk(); });
    attempt("account", "rolvane setup", [this] { return account(); });
}

Finding Doctor::database() {
    const std::string path = dataDirectory() + "/contacts.db";
    if (access(path.c_str(), F_OK) != 0) {
        requireKnownDatabase(path, Preferences::shared());
        return {"database",
                State::note,
                translated("There are no contacts yet."),
                "rolvane import FILE",
                {{"exists", false}}};
    }
    CXRolvane& database = _context.database();
    const size_t people = database.countPeople(RemoteLocation("")),
                 groups = database.listGroups(RemoteLocation("")).size();
    const Json figures{{"exists", true}, {"people", people}, {"groups", groups}};
    _databaseOpens = true;
    _sharesSomething = Publication(database).anything() || !subscriptionsToPeople(database).empty();
    std::string damage = damageOf(database);
    if (damage.empty())
        if (const Value noted = Preferences::shared().get(kDaemonDomain, kCXDDamagedDatabase); noted.isString())
            damage = noted.string();
    if (!damage.empty()) return {"database", State::failed, damage, "rolvane status", figures};
    return {"database",
            State::well,
            countedText(people, "person", "people") + ", " + countedText(groups, "group", "groups") + ".",
            {},
            figures};
}

Finding Doctor::preferences() {
    const size_t domains = Preferences::shared().domains().size();
    for (const std::string& key : Preferences::shared().keys(kDaemonDomain))
        (void)Preferences::shared().get(kDaemonDomain, key);
    return {"preferences", State::well, translated("They can be read."), {}, {{"domains", domains}}};
}

Finding Doctor::disk() {
    uint64_t least = UINT64_MAX;
    std::string where;
    bool isReadOnly = false;
    for (const std::string& directory : {dataDirectory(), stateDirectory(), configDirectory()}) {
        struct statvfs info {};
        if (statvfs(directory.c_str(), &info) != 0) continue;
        const uint64_t room = static_cast<uint64_t>(info.f_bavail) * info.f_frsize;
        isReadOnly = isReadOnly || access(directory.c_str(), W_OK) != 0;
        if (room >= least) continue;
        least = room;
        where = directory;
    }
    const uint64_t megabytes = least >> 20;
    const Json figures{{"freeMegabytes", megabytes}, {"writable", !isReadOnly}};
    if (isReadOnly)
        return {"disk", State::failed, translated("Your directories of rolvane cannot be written."),
                "ls -ld ~/.local/share/rolvane ~/.local/state/rolvane ~/.config/rolvane", figures};
    const std::string room = tr("{} MB are free where {} lies.", megabytes, where);
    if (least < kNoRoom)
        return {"disk", State::failed, room + translated(" That is too little."), "df -h " + where, figures};
    return {"disk", least < kLittleRoom ? State::note : State::well, room, {}, figures};
}

Finding Doctor::account() {
    _account = CXDAVAccount::load();
    if (!_account)
        return {"account",
                State::note,
                translated("There is no account on a store, so nothing is shared."),
                "rolvane setup",
                {{"exists", false}}};
    Finding found{"account",
                  State::well,
                  tr("{} at {}.", _account->user.str(), _account->endpoint),
                  {},
                  {{"exists", true}, {"privateAuthority", !_account->caFile.empty()}}};
    try {
        (void)_account->password();
    } catch (const CXException& error) {
        const bool isForService = _account->passwordSource.kind == PasswordSource::Kind::credential;
        found.state = isForService ? State::note : State::failed;
        found.what = error.reason();
        found.toDo = isForService ? "" : "rolvane account set --ask-password";
    }
    return found;
}

// The store ----------------------------------------------------------------------------------------------------------

void Doctor::examineStore() {
    if (!_account) return;
    const auto failure = testStore();
    _storeAnswers = !failure;
    const FailureScene scene = sceneOfTheAccount(now());
    if (failure) {
        const FailureText text = failureText(*failure, scene);
        const bool isLogin = text.code == kRefused;
        add({"address",
             isLogin ? State::well : State::failed,
             isLogin ? translated("The store answers.") : text.what,
             isLogin ? "" : "rolvane account test",
             {{"status", failure->status}, {"error", failure->error}}});
        add({"login", isLogin ? State::failed : State::unknown, isLogin ? text.what : translated("It was not tried."),
             isLogin ? "rolvane account set --ask-password" : "", Json::object()});
    } else {
        add({"address", State::well, tr("The store answers at {}.", scene.store), {}, Json::object()});
        add({"login", State::well, tr("The store lets {} in.", scene.self), {}, Json::object()});
    }
    attempt("authority", "rolvane account test", [this] { return authority(); });
    if (!_storeAnswers) return;
    attempt("clock", "timedatectl", [this] { return clock(); });
    trial();
    attempt("structure", "rolvane sync", [this] { return structure(); });
    attempt("computers", "rolvane status", [this] { return otherComputers(); });
}

// Whose certificates the store shows, and which of those that are believed ends first.
Finding Doctor::authority() {
    const auto chain = certificatesShownAt(Url(_account->origins().back() + "/"));
    const auto sooner = [](const ShownCertificate& a, const ShownCertificate& b) {
        return a.until.secondsSince1970() < b.until.secondsSince1970();
    };
    auto counted = chain;
    if (!_account->caFile.empty())
        for (ShownCertificate& own : certificatesIn(readFile(_account->caFile)))
            if (own.isAuthority || withFingerprint(chain, own.fingerprint)) counted.push_back(std::move(own));
    const auto first = *std::min_element(counted.begin(), counted.end(), sooner);
    const double left = first.until.secondsSince(now());
    const Json figures{{"certificates", chain.size()}, {"daysLeft", wholeDays(left)}};
    const std::string whose =
        first.isAuthority ? translated("The store's authority") : translated("The store's certificate");
    if (left < 0) {
        const bool isHere = _account->origins().back().find("://localhost") != std::string::npos;
        const std::string what = tr("{} ended on {}.", whose, shownDate(first.until));
        return {"authority", State::failed,
                isHere ? what : what + translated(" Whoever runs the store has to renew it; then try again."),
                isHere ? "rolvane store stop && rolvane store start" : "rolvane account test", figures};
    }
    return {"authority",
            left < kSoonDays * kDay ? State::note : State::well,
            tr("{} is good until {}.", whose, shownDate(first.until)),
            {},
            figures};
}

Finding Doctor::clock() {
    CXDAVManager& store = CXDAVManager::defaultManager();
    HttpRequest request;
    request.method = "OPTIONS";
    request.url = Url(_account->origins().back() + "/");
    const HttpResponse answer = store.transport().perform(std::move(request));
    const std::string* header = answer.header("date");
    const auto date = header ? Date::fromHTTP(*header) : std::nullopt;
    if (!date) return {"clock", State::unknown, translated("The store does not tell the time."), {}, Json::object()};
    const double apart = std::abs(date->secondsSince(now()));
    const Json figures{{"secondsApart", std::llround(apart)}};
    if (apart > kClockSeconds)
        return {"clock", State::failed,
                tr("This machine's clock and the store's are {} seconds apart.", std::llround(apart)),
                "timedatectl set-ntp true", figures};
    return {"clock", State::well, translated("This machine's clock and the store's agree."), {}, figures};
}

// WebDAV, locks, access lists and the rights in the own tree.
void Doctor::trial() {
    const StoreTrial trial = tryStore(CXDAVManager::defaultManager());
    const Json figures{{"dates", trial.dates},
                       {"tags", trial.tags},
                       {"locks", trial.locks},
                       {"conditions", trial.conditions},
                       {"accessLists", trial.accessLists},
                       {"status", trial.hindrance ? Json(trial.hindrance->status) : Json()}};
    if (trial.hindrance)
        add({"rights", State::failed,
             hinderedBy(*trial.hindrance, translated("Nothing can be published there.")).reason(),
             "rolvane account test", figures});
    else
        add({"rights",
             State::well,
             translated("The store lets you make, write, change and delete in your tree."),
             {},
             figures});
    std::string lacks;
    for (const std::string& line : consequences(trial)) lacks += (lacks.empty() ? "" : " ") + line;
    const State state = trial.hindrance ? State::unknown : lacks.empty() ? State::well : State::note;
    add({"webdav",
         state,
         trial.hindrance ? translated("It was not tried to the end.")
         : lacks.empty() ? translated("The store keeps locks, versions and access lists.")
                         : lacks,
         {},
         Json::object()});
}

Finding Doctor::structure() {
    const bool publishes = _databaseOpens && Publication(_context.database()).anything();
    if (!publishes)
        return {"structure", State::well, translated("Nothing is published from here."), {}, {{"publishes", false}}};
    const bool whole = CXDAVManager::defaultManager().sanityCheckPublishStructureCreate(false);
    const Json figures{{"publishes", true}, {"whole", whole}};
    if (whole) return {"structure", State::well, translated("Your published tree is whole."), {}, figures};
    return {"structure", State::failed, translated("Your published tree lacks something on the store."), "rolvane sync",
            figures};
}

Finding Doctor::otherComputers() {
    const bool publishes = _databaseOpens && Publication(_context.database()).anything();
    const PublishedAlready found = publishedAlready(CXDAVManager::defaultManager(), Preferences::shared(), publishes);
    const bool another = found.by == PublishedAlready::By::another;
    return {"computers",
            another ? (publishes ? State::failed : State::note) : State::well,
            publishedAlreadyText(found),
            another && publishes ? "rolvane status" : "",
            {{"another", another}}};
}

// The system ---------------------------------------------------------------------------------------------------------

void Doctor::examineSystem() {
    attempt("bus", "rolvane daemon status", [this] { return bus(); });
    attempt("launcher", "rolvane daemon start", [this] { return daemon(); });
    attempt("unit", "systemctl --user status RolvaneManager.service", [this] { return unit(); });
    attempt("queue", "rolvane sync", [this] { return queue(); });
}

Finding Doctor::bus() {
    const auto address = sessionBusAddress();
    const bool connected = address && connectBus(*address, std::chrono::seconds(5));
    return {"bus",
            connected ? State::well : State::note,
            connected
                ? translated("The session bus answers.")
                : translated(
                      "There is no session bus. Commands reach the daemon by its socket; other programs hear nothing."),
            {},
            {{"connected", connected}}};
}

Finding Doctor::daemon() {
    const DaemonControl control;
    (void)control.programPath();
    const auto process = control.running();
    const Json figures{{"running", process.has_value()}, {"shares", _sharesSomething}};
    if (process) return {"launcher", State::well, tr("RolvaneManager runs, process {}.", *process), {}, figures};
    if (!_sharesSomething)
        return {"launcher",
                State::well,
                translated("RolvaneManager does not run, and there is nothing to share."),
                {},
                figures};
    return {"launcher", State::failed, translated("RolvaneManager does not run, so nothing is kept in step."),
            "rolvane daemon start", figures};
}

Finding Doctor::unit() {
    const auto state = managersUnitState();
    if (!state)
        return {"unit",
                State::note,
                translated(
                    "No service manager of yours answers; the daemon is started directly, and not with your session."),
                {},
                {{"manager", false}}};
    const Json figures{{"manager", true},
                       {"loaded", state->loaded},
                       {"enabled", state->enabled},
                       {"stale", state->needsReload},
                       {"confined", state->confined},
                       {"apart", state->apart}};
    if (!state->loaded)
        return {"unit",
                State::note,
                translated("The unit RolvaneManager.service is not installed; the daemon is started directly."),
                {},
                figures};
    if (state->needsReload)
        return {"unit", State::failed, translated("The unit RolvaneManager.service has changed since it was read."),
                "systemctl --user daemon-reload", figures};
    if (state->forbidden)
        return {"unit", State::failed,
                translated("The unit RolvaneManager.service cannot start: the kernel forbids user namespaces. The "
                           "section CONFINEMENT of its manual page has the lines that do without."),
                "man RolvaneManager", figures};
    if (!state->confined)
        return {"unit", State::failed,
                translated(
                    "The unit RolvaneManager.service does not confine the daemon: something overrides its settings."),
                "systemctl --user cat RolvaneManager.service", figures};
    if (!state->apart)
        return {"unit", State::note,
                translated("The unit RolvaneManager.service confines the daemon in part, without a user namespace."),
                "man RolvaneManager", figures};
    if (!state->enabled)
        return {"unit", State::note, translated("The daemon does not start with your session."),
                "systemctl --user enable RolvaneManager.socket RolvaneManager.service", figures};
    return {"unit", State::well, translated("The daemon starts with your session, confined."), {}, figures};
}

Finding Doctor::queue() {
    const auto outcome = lastOutcome(Preferences::shared());
    if (!outcome)
        return {"queue",
                _sharesSomething ? State::note : State::well,
                translated("No pass has been made yet."),
                {},
                {{"passes", 0}}};
    int64_t waiting = 0;
    double oldest = 0;
    for (const PassTree& tree : outcome->trees)
        for (const PassDirection& direction : {tree.out, tree.in}) {
            waiting += direction.waiting;
            if (direction.waitingSince) oldest = std::max(oldest, now().secondsSince(*direction.waitingSince));
        }
    const Json figures{{"passes", outcome->number},
                       {"waiting", waiting},
                       {"oldestHours", std::llround(oldest / 3600)},
                       {"hoursSincePass", std::llround(now().secondsSince(outcome->ended) / 3600)}};
    if (waiting == 0) return {"queue", State::well, translated("Nothing waits."), {}, figures};
    const std::string what = tr("{}, the oldest for {} hours.", countedText(waiting, "change waits", "changes wait"),
                                std::llround(oldest / 3600));
    return {"queue", oldest > kDay ? State::failed : State::note, what, "rolvane sync", figures};
}

// The report ---------------------------------------------------------------------------------------------------------

bool allWell(const std::vector<Finding>& findings) {
    return std::none_of(findings.begin(), findings.end(), [](const Finding& f) { return f.state == State::failed; });
}

nlohmann::ordered_json findingsJson(const std::vector<Finding>& findings) {
    Json all = Json::array();
    for (const Finding& f : findings)
        all.push_back({{"check", f.check},
                       {"state", stateName(f.state)},
                       {"what", f.what},
                       {"toDo", f.toDo.empty() ? Json() : Json(f.toDo)}});
    return {{"well", allWell(findings)}, {"findings", all}};
}

nlohmann::ordered_json bundleOf(const std::vector<Finding>& findings, const std::string& version) {
    Json all = Json::object();
    for (const Finding& f : findings) {
        Json told{{"state", stateName(f.state)}};
        for (const auto& [key, value] : f.figures.items())
            if (value.is_number() || value.is_boolean() || value.is_null()) told[key] = value;
        all[f.check] = told;
    }
    return {{"rolvane", version}, {"well", allWell(findings)}, {"checks", all}};
}

} // namespace rolvane::cli
