#include "Stage.h"

#include "../worlds/Report.h"
#include "../worlds/StoreView.h"
#include "foundation/CXException.h"
#include "support/UserWorld.h"

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <new>
#include <sstream>
#include <sys/mman.h>
#include <unistd.h>

namespace rolvane::board {

namespace {

namespace fs = std::filesystem;
using namespace worlds;
constexpr double kPatience = 60; // seconds for one process
constexpr const char* kHost = "contacts.example.org";
constexpr std::pair<const char*, const char*> kDirectories[] = {{"XDG_DATA_HOME", "data"},
                                                                {"XDG_STATE_HOME", "state"},
                                                                {"XDG_CACHE_HOME", "cache"},
                                                                {"XDG_CONFIG_HOME", "config"},
                                                                {"XDG_RUNTIME_DIR", "runtime"}};

[[noreturn]] void fail(const std::string& what) {
    throw CXException("CXBoardException", what);
}

void shell(const std::string& command) {
    if (std::system(command.c_str()) != 0) fail("could not " + command);
}

} // namespace

Stage::Stage(PrivateStore& store, std::string shim, uint64_t seed, bool withEntrance)
    : _store(store), _shim(std::move(shim)), _seed(seed), _suffix([] {
          static int serial = 0; // one tree is never used for two stages
          return std::to_string(++serial);
      }()) {
    if (withEntrance) {
        _entrance = std::make_unique<test::FaultyStore>(store);
        _tls = std::make_unique<TlsEntrance>(_entrance->port(), store.stateDirectory() + "/tls/server.pem",
                                             store.stateDirectory() + "/tls/server.key");
    }
    const std::string path = _directory / "control";
    const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0 || ::ftruncate(fd, sizeof(FaultControl)) != 0) fail("no file for the control");
    void* page = ::mmap(nullptr, sizeof(FaultControl), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    ::close(fd);
    if (page == MAP_FAILED) fail("no memory for the control");
    _control = new (page) FaultControl;
    begin();
}

Stage::~Stage() {
    ::munmap(_control, sizeof(FaultControl));
    std::error_code none;
    for (const char* role = kRoles; *role; ++role) {
        _store.removeUser(userOf(*role));
        fs::remove_all(_store.userDirectory(userOf(*role)), none);
    }
}

void Stage::begin() {
    fs::create_directory(_directory / "kept");
    for (const char* each = kRoles; *each; ++each) {
        const char role = *each;
        fs::create_directory(home(role));
        for (const auto& [variable, directory] : kDirectories) {
            fs::create_directory(home(role) + "/" + directory);
            fs::permissions(home(role) + "/" + directory, fs::perms::owner_all);
        }
        _store.addUser(userOf(role), _password);
        const std::string endpoint = _tls ? "https://localhost:" + std::to_string(_tls->port()) + "/dav/{user}/Contacts"
                                          : _store.endpointTemplate();
        const Ending set = command(role,
                                   {"account", "set", "--user", userOf(role), "--endpoint", endpoint, "--ca-file",
                                    _store.caFile(), "--host", kHost, "--ask-password"},
                                   {}, _password + "\n");
        if (set.status != 0) fail("no account: " + set.log);
        (void)command(role, {"defaults", "write", "CXDDebugLevel", "1"});
    }
    edit(
        'o', [](Editor& editor) { editor.makeAtFirst(5, 3); }, "0");
    for (const std::vector<std::string>& line : {std::vector<std::string>{"publish", "--no-daemon"},
                                                 {"share", userOf('r'), "--no-daemon"},
                                                 {"share", userOf('w'), "--write", "--no-daemon"}})
        if (const Ending done = command('o', line); done.status != 0) fail(line[0] + ": " + done.log);
}

RemoteLocation Stage::locationFor(char role) const {
    return RemoteLocation(role == 'o' ? "" : std::string("http://") + kHost + "/" + userOf('o') + "/Contacts");
}

std::vector<std::string> Stage::environmentOf(char role) const {
    std::vector<std::string> all{"HOME=" + home(role),  "PATH=/usr/bin:/bin",
                                 "LANG=C.UTF-8",        "ROLVANE_MANAGER=" + test::UserWorld::managerProgram(),
                                 "LD_PRELOAD=" + _shim, std::string(kControlVariable) + "=" + _directory / "control"};
    for (const auto& [variable, directory] : kDirectories)
        all.push_back(std::string(variable) + "=" + home(role) + "/" + directory);
    if (!_leftOut.empty()) all.push_back("ROLVANE_LEFT_OUT=" + _leftOut);
    if (const char* temporary = std::getenv("TMPDIR")) all.push_back(std::string("TMPDIR=") + temporary);
    return all;
}

Ending Stage::run(char role, std::vector<std::string> arguments, const Fault& fault, const std::string& input) {
    FaultControl& c = *_control;
    std::strncpy(c.root, home(role).c_str(), sizeof c.root - 1);
    std::strncpy(c.record, fault.record.c_str(), sizeof c.record - 1);
    c.where[0] = '\0';
    c.at = fault.kind == FaultControl::none ? -1 : fault.at;
    c.length = fault.length;
    c.kind = fault.kind;
    c.network = fault.network ? 1 : 0;
    c.clock = fault.clock;
    c.count = c.met = 0;

    std::string line = std::string(1, role) + ":";
    for (size_t i = 0; i < arguments.size(); ++i)
        line += " " + (i > 0 ? arguments[i] : fs::path(arguments[0]).filename().string());
    test::ChildProcess child({.arguments = std::move(arguments), .environment = environmentOf(role), .input = input});
    if (input.empty()) child.closeInput();
    const auto ended = child.wait(kPatience);
    if (!ended) child.kill();
    Ending ending;
    ending.late = !ended;
    ending.status = ended ? ended->status : -1;
    ending.signal = ended ? ended->signal : 0;
    ending.killed = ended && ended->signal == SIGKILL;
    ending.operations = c.count;
    ending.met = c.met;
    ending.where = c.where;
    ending.output = child.output();
    ending.log = child.errors();
    tell("== " + line);
    if (ending.met > 0)
        tell("   FAULT at operation " + std::to_string(fault.at) + ", " + std::to_string(ending.met) +
             " met: " + ending.where);
    tell(ending.output + ending.log);
    return ending;
}

Ending Stage::pass(char role, const Fault& fault) {
    return run(role, {_leftOut.empty() ? test::UserWorld::managerProgram() : ROLVANE_SWITCHED_MANAGER, "-p"}, fault,
               {});
}

std::unique_ptr<test::ChildProcess> Stage::startDaemon(char role) {
    return std::make_unique<test::ChildProcess>(test::ChildProcess::Options{
        .arguments = {test::UserWorld::managerProgram()}, .environment = environmentOf(role)});
}

Ending Stage::command(char role, std::vector<std::string> arguments, const Fault& fault, const std::string& input) {
    arguments.insert(arguments.begin(),
                     _leftOut.empty() ? test::UserWorld::rolvaneProgram() : ROLVANE_SWITCHED_ROLVANE);
    return run(role, std::move(arguments), fault, input);
}

void Stage::edit(char role, const Habits& habits, const std::string& stamp) {
    edit(
        role, [&](Editor& editor) { editor.edit(habits); }, stamp);
}

void Stage::edit(char role, const std::function<void(Editor&)>& work, const std::string& stamp) {
    const std::string told = _directory / "told";
    const int fd = ::open(told.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    Report report(fd);
    {
        CXRolvane database(CXRolvane::Options{.path = databaseOf(role), .program = "rolvane"});
        Editor editor(role, database, locationFor(role), hashOf(stamp + role, _seed), stamp, report);
        work(editor);
    }
    ::close(fd);
    std::ifstream lines(told);
    for (std::string line; std::getline(lines, line);) {
        tell(std::string(1, role) + " edits: " + line);
        if (line[0] == worlds::lines::kDeed) _model.take(deedOf(fieldsOf(line)));
    }
}

void Stage::keep(const std::string& name) {
    const std::string kept = _directory / ("kept/" + name), tree = _store.userDirectory(userOf('o'));
    shell("rm -rf " + kept + " && mkdir " + kept + " && cp -a " + home('o') + " " + home('w') + " " + home('r') + " " +
          kept + " && cp -a " + tree + " " + kept + "/tree && cp -a " + _store.stateDirectory() + "/lists " + kept +
          "/lists");
    _keptModels[name] = _model;
}

void Stage::bringBack(const std::string& name) {
    expireLocks(); // of the case before
    const std::string kept = _directory / ("kept/" + name), tree = _store.userDirectory(userOf('o')),
                      lists = _store.stateDirectory() + "/lists";
    shell("rm -rf " + home('o') + " " + home('w') + " " + home('r') + " " + tree + "/Contacts " + lists +
          "/*.acl && cp -a " + kept + "/o " + kept + "/w " + kept + "/r " + _directory.path() + " && cp -a " + kept +
          "/tree/. " + tree + "/ && cp -a " + kept + "/lists/. " + lists + "/");
    _model = _keptModels.at(name);
    (void)writesToTheStore();
}

void Stage::bringBackHome(const std::string& name, char role) {
    shell("rm -rf " + home(role) + " && cp -a " + kept(name, role) + " " + home(role));
}

void Stage::loseFromTree(const std::function<bool(const std::string& file, size_t number)>& isLost) {
    std::vector<fs::path> files;
    for (const auto& entry : fs::recursive_directory_iterator(_store.userDirectory(userOf('o')) + "/Contacts"))
        if (entry.is_regular_file()) files.push_back(entry.path());
    std::sort(files.begin(), files.end(),
              [](const fs::path& a, const fs::path& b) { return a.filename() < b.filename(); });
    std::map<std::string, size_t> numbers; // by ending
    for (const fs::path& file : files) {
        const std::string name = file.filename();
        const size_t colon = name.find(':');
        if (isLost(name, numbers[colon == std::string::npos ? name : name.substr(colon)]++)) fs::remove(file);
    }
}

std::string Stage::scratch(const std::string& name) const {
    std::string path = _directory / name;
    fs::remove(path);
    return path;
}

View Stage::view(char role) const {
    CXRolvane database(CXRolvane::Options{.path = databaseOf(role), .program = "rolvane"});
    View seen = Editor::view(database, locationFor(role));
    if (role != 'o' && database.countPeople(RemoteLocation("")) > 0)
        seen.faults.push_back("somebody else's contact became the person's own");
    if (role != 'o' && !database.findSubscriptionWithRemoteLocation(locationFor(role)))
        seen.faults.push_back("the subscription is gone");
    return seen;
}

View Stage::storeView() const {
    return viewOfStore(_store.userDirectory(userOf('o')) + "/Contacts");
}

std::vector<std::string> Stage::writesToTheStore() {
    std::ifstream log(_store.stateDirectory() + "/logs/access.log", std::ios::binary);
    log.seekg(static_cast<std::streamoff>(_logRead));
    std::vector<std::string> writes;
    for (std::string line; std::getline(log, line);) {
        _logRead += line.size() + 1;
        std::istringstream fields(line);
        std::string when, user, method, path;
        int status = 0;
        size_t bytes = 0;
        fields >> when >> user >> method >> status >> bytes >> path;
        const bool changes = method == "PUT" || method == "DELETE" || method == "MKCOL" || method == "MOVE" ||
                             method == "COPY" || method == "PROPPATCH" || method == "ACL";
        if (changes && status < 400 && !path.ends_with("/dateFile")) writes.push_back(method + " " + path);
    }
    return writes;
}

HttpResponse Stage::ask(char role, const std::string& method, std::vector<std::pair<std::string, std::string>> headers,
                        const std::string& body) const {
    CurlTransportOptions options;
    options.caFile = _store.caFile();
    CurlTransport transport(options);
    HttpRequest request;
    request.method = method;
    request.url = Url(_store.baseURL() + "/" + userOf('o') + "/Contacts/dateFile");
    request.headers = std::move(headers);
    if (!body.empty()) request.body = std::make_shared<const std::string>(body);
    transport.setCredentials(
        TransportCredentials{userOf(role), _password, {request.url.origin()}, TransportCredentials::Scheme::basic});
    return transport.perform(std::move(request));
}

std::vector<std::string> Stage::locksOnTheStore() const {
    const HttpResponse answer =
        ask('o', "PROPFIND", {{"Depth", "0"}, {"Content-Type", "application/xml"}},
            "<?xml version=\"1.0\"?><propfind xmlns=\"DAV:\"><prop><lockdiscovery/></prop></propfind>");
    if (!answer.complete() || answer.status != 207) return {"unknown, as the store does not say"};
    std::vector<std::string> tokens;
    const std::string scheme = "opaquelocktoken:";
    for (size_t at = 0; (at = answer.body.find(scheme, at)) != std::string::npos; at += scheme.size())
        tokens.push_back(answer.body.substr(at, answer.body.find('<', at) - at));
    return tokens;
}

void Stage::expireLocks() {
    for (const std::string& token : locksOnTheStore())
        for (const char* role = kRoles; *role; ++role)
            if (ask(*role, "UNLOCK", {{"Lock-Token", "<" + token + ">"}}, {}).status == 204)
                tell("the lock of " + std::string(1, *role) + " runs out");
}

} // namespace rolvane::board
