#include "World.h"

#include "StoreView.h"
#include "conduits/store/ComputersOnStore.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane::worlds {

namespace {

namespace fs = std::filesystem;
constexpr int kPatience = 180; // seconds for one process
constexpr const char* kPassword = "open sesame";

// Log lines of a daemon, behind whose they are.
class FileLog : public LogSink {
public:
    explicit FileLog(int descriptor) : _descriptor(descriptor) {}
    void write(std::string_view line) override {
        const std::string whole = "      " + std::string(line) + "\n";
        [[maybe_unused]] const ssize_t n = ::write(_descriptor, whole.data(), whole.size());
    }

private:
    const int _descriptor;
};

} // namespace

World::World(PrivateStore& store, uint64_t seed, Options options)
    : _store(store), _seed(seed), _options(std::move(options)), _chance(hashOf("world", seed)),
      _climate(climateOf(_chance)) {
    _outcome.seed = seed;
    _model.mergesProperties = with("merging");
    static int serial = 0; // one tree is never used for two worlds
    const std::string suffix = std::to_string(seed) + "-" + std::to_string(++serial);
    const char* temporary = std::getenv("TMPDIR");
    _directory = std::string(temporary ? temporary : "/tmp") + "/world-" + suffix;
    fs::create_directories(_directory);
    for (const char role : {'o', 'w', 'r', 's'}) {
        if (role == 's' && !_options.second) continue;
        Person made;
        made.role = role;
        made.password = kPassword;
        made.account.user = UserName((made.isOwner() ? 'o' : role) + suffix);
        made.account.endpoint = _store.endpointTemplate();
        made.account.nameHost = "contacts.example.org";
        made.account.caFile = _store.caFile();
        made.directory = _directory + "/" + role;
        made.tree = made.account.baseLocationFor(UserName("o" + suffix));
        made.threads = static_cast<int>(_chance.between(1, 4));
        fs::create_directories(made.directory + "/state");
        if (role != 's') _store.addUser(made.account.user.str(), kPassword);
        _people.push_back(made);
    }
    if (_options.second) makeSecondComputer();
    _log = ::open((_directory + "/story").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
}

World::~World() {
    ::close(_log);
    std::error_code none;
    if (!_options.keep.empty() && (_options.keepAll || !_outcome.differences.empty())) {
        const std::string kept = _options.keep + "/world-" + std::to_string(_seed);
        fs::remove_all(kept, none);
        fs::create_directories(kept, none);
        fs::copy(_directory, kept, fs::copy_options::recursive, none);
        fs::copy(_store.userDirectory(_people[0].account.user.str()), kept + "/tree", fs::copy_options::recursive,
                 none);
    }
    fs::remove_all(_directory, none);
    std::set<std::string> users;
    for (const Person& each : _people) users.insert(each.account.user.str());
    for (const auto& [role, mayRead] : _mayRead) users.insert(readerOf(role));
    for (const std::string& user : users) {
        _store.removeUser(user);
        fs::remove_all(_store.userDirectory(user), none);
    }
}

Person& World::person(char role) {
    return *std::find_if(_people.begin(), _people.end(), [&](const Person& each) { return each.role == role; });
}

char World::selfOf(char role) const {
    const auto former = _selves.find(role);
    return former == _selves.end() ? role : former->second;
}

std::vector<char> World::roles() const {
    return _hasJoined ? std::vector<char>{'o', 's', 'w', 'r'} : std::vector<char>{'o', 'w', 'r'};
}

World::Climate World::climateOf(Chance& chance) const {
    Climate made;
    made.people = chance.between(3, 12);
    made.groups = chance.between(1, 5);
    made.steps = chance.between(14, 34);
    switch (chance.below(6)) {
    case 0: // few contacts, and the last one goes, too
        made.people = chance.between(1, 3);
        made.habits.make = 4;
        made.habits.remove = 22;
        made.habits.removeAll = 3;
        break;
    case 1: // groups in groups, turned round
        made.groups = chance.between(3, 6);
        made.habits.nest = made.habits.turn = 20;
        made.habits.text = 10;
        break;
    case 2: // everybody at the same two contacts
        made.people = 2;
        made.groups = 1;
        made.habits.make = made.habits.remove = 1;
        made.habits.text = 60;
        made.habits.phone = 40;
        break;
    case 3: // much in one save
        made.habits.most = 12;
        break;
    default: break;
    }
    made.habits.leaveOne = !with("last");
    if (!with("nesting")) made.habits.nest = made.habits.unnest = made.habits.turn = 0;
    const std::vector<double> rates{0, 0.02, 0.05, 0.1, 0.2};
    made.faults = chance.oneOf(rates);
    made.kills = chance.oneOf(std::vector<double>{0, 0.2, 0.4});
    made.outages = chance.oneOf(std::vector<double>{0, 0.1, 0.3});
    made.fullDisks = chance.oneOf(std::vector<double>{0, 0, 0.1, 0.2});
    made.overlaps = chance.oneOf(std::vector<double>{0, 0.2, 0.5});
    made.refusals = chance.happens(0.15);
    if (!with("faults")) made.faults = 0;
    if (!with("kills")) made.kills = 0;
    if (!with("outages")) made.outages = 0;
    if (!with("disks")) made.fullDisks = 0;
    if (!with("overlap")) made.overlaps = 0;
    if (!with("refusals")) made.refusals = false;
    if (_options.second) made.steps = chance.between(24, 44);
    if (_options.steps > 0) made.steps = static_cast<size_t>(_options.steps);
    return made;
}

void World::tell(const std::string& text) {
    const std::string line = text + "\n";
    [[maybe_unused]] const ssize_t n = ::write(_log, line.data(), line.size());
}

// Processes ----------------------------------------------------------------------------------------------------------

void World::inProcess(const std::string& what, char who, const Work& work, View* view) {
    inProcesses(what, {{who, work}}, view);
}

void World::inProcesses(const std::string& what, const std::vector<Job>& jobs, View* view) {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) != 0) throw CXException("CXWorldException", "no pipe");
    std::map<pid_t, char> children;
    for (const auto& [who, work] : jobs) {
        tell("== " + what + " of " + who + ", process " + std::to_string(++_processes));
        const pid_t child = ::fork();
        children[child] = who;
        if (child != 0) continue;
        ::close(ends[0]);
        for (const char* name : {"XDG_STATE_HOME", "XDG_DATA_HOME", "XDG_CACHE_HOME", "XDG_CONFIG_HOME"})
            ::setenv(name, (person(who).directory + "/state").c_str(), 1);
        LogSink::install(std::make_shared<FileLog>(_log));
        setDebugLevel(1);
        Report report(ends[1], std::string(1, who));
        try {
            work(report);
        } catch (const CXException& exception) {
            report.line(lines::kWrong, what + ": " + exception.reason());
        }
        ::_exit(0);
    }
    ::close(ends[1]);
    std::string waiting;
    bool late = false;
    for (char bytes[65536];;) {
        pollfd ready{ends[0], POLLIN, 0};
        if (!late && ::poll(&ready, 1, kPatience * 1000) == 0) {
            late = true;
            for (const auto& [child, who] : children) {
                _wrong.push_back(what + " of " + who + " does not end");
                ::kill(child, SIGKILL);
            }
        }
        const ssize_t n = ::read(ends[0], bytes, sizeof bytes);
        if (n <= 0) break;
        waiting.append(bytes, static_cast<size_t>(n));
        for (size_t end = 0; (end = waiting.find('\n')) != std::string::npos; waiting.erase(0, end + 1))
            take(waiting[0], waiting.substr(1, end - 1), view);
    }
    ::close(ends[0]);
    for (const auto& [child, who] : children) {
        int status = 0;
        ::waitpid(child, &status, 0);
        if (WIFSIGNALED(status) && WTERMSIG(status) != SIGKILL)
            _wrong.push_back(what + " of " + who + " ended by signal " + std::to_string(WTERMSIG(status)));
    }
    copyAll("end");
}

void World::copyAll(const std::string& moment) {
    if (!_options.copies) return;
    const std::string where = _directory + "/copies/" + std::to_string(_processes) + "-" + moment;
    fs::create_directories(where);
    std::error_code none;
    for (const Person& each : _people)
        for (const char* suffix : {"", "-wal"})
            fs::copy_file(each.database() + suffix, where + "/" + each.role + ".db" + suffix, none);
    fs::copy(_store.userDirectory(_people[0].account.user.str()) + "/Contacts", where + "/tree",
             fs::copy_options::recursive, none);
}

void World::take(char who, const std::string& line, View* view) {
    const char kind = line.empty() ? ' ' : line[0];
    const std::vector<std::string> fields = fieldsOf(line);
    if (kind != lines::kPerson && kind != lines::kGroup && kind != lines::kCell && kind != lines::kWhole)
        tell("   " + line);
    const char self = selfOf(who);
    switch (kind) {
    case lines::kDeed: {
        Deed deed = deedOf(fields);
        deed.who = self;
        _model.take(deed);
        ++_outcome.edits;
        break;
    }
    case lines::kKilled: ++_outcome.kills; break;
    case lines::kFault: ++(fields.at(0).starts_with("away") ? _outcome.away : _outcome.faults); break;
    case lines::kRefused:
        ++_outcome.refusals;
        _model.refused(self);
        break;
    case lines::kDiskFull: ++_outcome.diskFailures; break;
    case lines::kSettled:
        _model.settled(self);
        _settled.insert(who);
        _rightsToSend.erase(who);
        break;
    case lines::kWrote: _wrote.push_back(std::string(1, who) + " " + fields.at(0)); break;
    case lines::kThrew: ++_outcome.exceptions; break;
    case lines::kWrong: _wrong.push_back(std::string(1, who) + ": " + fields.at(0)); break;
    default:
        if (view) readViewLine(kind, fields, *view);
    }
}

// The course of things
// --------------------------------------------------------------------------------------------------

void World::edit(char who, const std::string& stamp, uint64_t seed, Report& report) {
    const Unharmed unharmed;
    const std::lock_guard guard(report.whole());
    CXRolvane database(CXRolvane::Options{.path = person(who).database(), .program = "rolvane"});
    Editor(who, database, person(who).location(), seed, stamp, report).edit(_climate.habits);
}

void World::begin() {
    inProcess("beginning", 'o', [&](Report& report) {
        CXRolvane database(CXRolvane::Options{.path = person('o').database(), .program = "rolvane"});
        const auto all = database.allGroup();
        const auto of = [](std::initializer_list<std::string> users) {
            CXMutableMultiValue values;
            for (const std::string& user : users) values.addValue(user, user);
            return values;
        };
        const std::string writer = person('w').account.user.str(), reader = person('r').account.user.str();
        all->setValue(of({writer, reader}), kCXReadSharingACLProperty);
        all->setValue(of({writer}), kCXReadWriteSharingACLProperty);
        CXMutableMultiValue where;
        where.addValue(person('o').tree.absoluteString(), kCXPublishLabel);
        all->setValue(where, kCXRemoteLocationProperty);
        database.save();
        Editor('o', database, {}, hashOf("first", _seed), "0", report).makeAtFirst(_climate.people, _climate.groups);
    });
    if (_options.second) beginSecondComputer();
    clean('o');
    for (const char role : {'w', 'r'})
        inProcess("subscribing", role, [&, role](Report&) {
            CXRolvane database(CXRolvane::Options{.path = person(role).database(), .program = "rolvane"});
            database.addRecord(CXSubscription::create(person(role).location()));
            database.save();
        });
    if (_chance.happens(0.7))
        for (const char role : {'w', 'r'}) clean(role);
}

Weather World::weather() {
    Weather made;
    made.seed = _chance.next();
    made.faults = _chance.happens(0.8) ? _climate.faults : 0;
    made.refusesWriter = _climate.refusals;
    made.without = _options.without;
    if (_chance.happens(_climate.kills)) {
        if (_chance.happens(0.6))
            made.kill = _chance.happens(0.5) ? 0.02 : 0.08;
        else
            made.killBeforeWrite = static_cast<int>(_chance.below(70));
    }
    if (_chance.happens(_climate.outages)) {
        made.storeAwayFrom = _chance.happens(0.4) ? 0 : static_cast<int>(_chance.below(50));
        made.portal = _chance.happens(0.25) && with("portal");
    }
    if (_chance.happens(_climate.fullDisks)) {
        made.diskFullFrom = static_cast<int>(_chance.below(60));
        made.diskFullFor = _chance.happens(0.5) ? static_cast<int>(_chance.between(1, 5)) : 1 << 20;
    }
    return made;
}

// A daemon from its start: a pass, and while it goes on edits are made beside it.
void World::live(char role, const std::string& stamp, const Weather& weather, uint64_t seed, Report& report) {
    Chance chance(seed);
    endureOnDisk(weather, report);
    Daemon daemon(person(role), weather, report);
    const bool edits = role != 'r' && (role != 'w' || with("writer"));
    std::atomic<int> beside = 0;
    const double overlaps = edits ? _climate.overlaps : 0;
    if (chance.happens(overlaps))
        daemon.wire().meanwhile = [&](uint64_t number) {
            if (Chance(number).happens(0.05) && beside < 3)
                edit(role, stamp + "b" + std::to_string(++beside), number, report);
        };
    daemon.pass();
    copyAll("first");
    if (daemon.nothingWaits()) report.line(lines::kSettled);
    for (size_t more = chance.below(3); more > 0; --more) {
        if (edits && chance.happens(0.7)) edit(role, stamp + "d" + std::to_string(more), chance.next(), report);
        chance.happens(0.6) ? daemon.deliver() : daemon.pass();
        copyAll("more" + std::to_string(more));
        if (daemon.nothingWaits()) report.line(lines::kSettled);
    }
}

void World::step(size_t number) {
    const std::string stamp = std::to_string(number);
    if (_options.second && (number == _joinsAt ? (join(), true) : hasStepOfItsOwn(stamp))) return;
    const uint64_t seed = _chance.next();
    const std::string turns = _hasJoined ? "oosswwossrosr" : "owwooowrr";
    const char role = turns[_chance.below(turns.size())];
    const bool edits = role != 'r' && (role != 'w' || with("writer")) && _chance.happens(0.4);
    const Weather today = weather();
    if (edits) {
        inProcess("edits", role, [&](Report& report) { edit(role, stamp, seed, report); });
        return;
    }
    serve({{role, seed, today}}, stamp);
}

// Daemons, at the same time where there are several.
void World::serve(std::vector<Service> services, const std::string& stamp) {
    std::vector<Job> jobs;
    for (Service& each : services) {
        ++_outcome.passes;
        each.weather.ownTree = "/dav/" + person(each.role).account.user.str() + "/";
        jobs.push_back({each.role, [&](Report& report) { live(each.role, stamp, each.weather, each.seed, report); }});
    }
    inProcesses("daemon", jobs);
}

void World::clean(char role) {
    inProcess("clean daemon", role, [&](Report& report) {
        // What a store has refused rests for half an hour at most; half a new contact is left for a week.
        constexpr double kAnHour = 3600, kAWeek = 7 * 86400;
        Weather calm;
        if (_settling) calm.later = kAnHour + static_cast<double>(_outcome.cleanPasses) * kAWeek;
        if (_afterRest) calm.later = kAnHour;
        calm.ownTree = "/dav/" + person(role).account.user.str() + "/";
        Daemon daemon(person(role), calm, report);
        daemon.pass();
        daemon.deliver(); // as the program does when its run loop turns
        if (daemon.nothingWaits()) report.line(lines::kSettled);
    });
}

// The end -----------------------------------------------------------------------------------------------------------

View World::viewOf(char role) {
    View view;
    inProcess(
        "view", role,
        [&](Report& report) {
            CXRolvane database(CXRolvane::Options{.path = person(role).database(), .program = "rolvane"});
            View seen = Editor::view(database, person(role).location());
            if (!person(role).isOwner() && database.countPeople(RemoteLocation("")) > 0)
                seen.faults.push_back("somebody else's contact became the person's own");
            if (!person(role).isOwner() && !database.findSubscriptionWithRemoteLocation(person(role).location()))
                seen.faults.push_back("the subscription is gone");
            report.view(seen);
        },
        &view);
    return view;
}

std::vector<std::string> World::compareAll() {
    std::vector<std::string> all;
    const auto add = [&](const std::string& where, const std::vector<std::string>& found) {
        for (const std::string& each : found) all.push_back(where + ": " + each);
    };
    const View owner = viewOf('o'),
               store =
                   viewOfStore(_store.userDirectory(person('o').account.user.str()) + "/Contacts",
                               _hasJoined ? std::set<std::string>{ComputersOnStore::kFile} : std::set<std::string>{});
    add("owner", _model.differences(owner));
    add("store", _model.differences(store));
    const auto compare = [&](const auto& ours, const auto& theirs, const std::string& whose) {
        std::set<std::string> names;
        for (const auto* each : {&ours, &theirs})
            for (const auto& [name, value] : *each) names.insert(name);
        for (const std::string& name : names) {
            const auto a = ours.find(name), b = theirs.find(name);
            if (a == ours.end() || b == theirs.end())
                all.push_back(name + " is missing at " + (a == ours.end() ? "owner" : whose));
            else if (a->second != b->second)
                all.push_back(name + " differs between owner and " + whose);
        }
    };
    compare(owner.people, store.people, "store");
    compare(owner.groups, store.groups, "store");
    for (const char role : roles()) {
        if (role == 'o') continue;
        const View copy = viewOf(role);
        const std::string whose = role == 'w' ? "writer" : role == 'r' ? "reader" : "second computer";
        add(whose, _model.differences(copy));
        compare(owner.whole, copy.whole, whose);
    }
    if (_hasJoined) add("rights", wrongRights());
    return all;
}

void World::settle() {
    constexpr size_t kRounds =
        4; // a circle of groups that a pass of the last one brings takes two looks of the owner's
    _settling = true;
    tell("== all is well again");
    for (size_t round = 1; round <= kRounds; ++round) {
        for (const char role : roles()) clean(role);
        _outcome.cleanPasses = round;
        if (round == 1) continue;
        _outcome.differences = compareAll();
        if (_outcome.differences.empty()) break;
    }
    // Once more: there is nothing left to do.
    _wrote.clear();
    for (const char role : roles()) clean(role);
    for (const std::string& write : _wrote)
        if (!write.ends_with(ComputersOnStore::kFile)) // a computer tells once an hour that it is there
            _outcome.differences.push_back("not at rest: " + write);
    for (const std::string& wrong : _wrong) _outcome.differences.push_back(wrong);
    for (const Person& each : _people) {
        std::error_code none;
        for (const auto& left : fs::directory_iterator(each.directory + "/state/rolvane/locks", none))
            _outcome.differences.push_back(std::string(1, each.role) +
                                           " still has a note of a lock: " + left.path().filename().string());
    }
    for (const std::string& difference : _outcome.differences) tell("!! " + difference);
}

Outcome World::run() {
    const auto start = std::chrono::steady_clock::now();
    begin();
    for (size_t number = 1; number <= _climate.steps; ++number) step(number);
    settle();
    _outcome.conflicts = _model.conflicts;
    _outcome.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    return _outcome;
}

} // namespace rolvane::worlds
