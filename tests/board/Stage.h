#pragma once

#include "../apps/FaultyStore.h"
#include "../worlds/Chance.h"
#include "../worlds/Editor.h"
#include "../worlds/Model.h"
#include "FaultControl.h"
#include "TlsEntrance.h"
#include "foundation/Url.h"
#include "server/PrivateStore.h"
#include "store/http/HttpTransport.h"
#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace rolvane::board {

// What befalls one process.
struct Fault {
    FaultControl::Kind kind = FaultControl::none;
    int64_t at = -1, length = 1; // the first operation that meets it, and how many do
    bool network = false;        // requests count as operations, too
    int64_t clock = 0;           // seconds that it lives behind the others
    std::string record = {};     // a file for the changes that it makes to files
};

// How a process ended.
struct Ending {
    bool killed = false, late = false; // late: it had to be ended after a minute
    int status = 0, signal = 0;
    int64_t operations = 0, met = 0;
    std::string where; // the operation that met the fault last
    std::string output, log;
};

// Three people on a private store: 'o' the owner, 'w' who may write, 'r' who may read. Each has a home; commands and
// daemons are the real programs. Edits are made in this process, as another contact application makes them, and told to
// the model. One thread.
class Stage {
public:
    static constexpr const char* kRoles = "owr";
    // Programs are run with the library at `shim`. With an entrance every request of the three goes through it.
    Stage(PrivateStore& store, std::string shim, uint64_t seed, bool withEntrance);
    ~Stage();
    Stage(const Stage&) = delete;
    Stage& operator=(const Stage&) = delete;

    // The programs from now on do without that part of themselves (foundation/TestSwitch.h); "" and they are those that
    // are installed.
    void leaveOut(const std::string& part) { _leftOut = part; }

    Ending pass(char role, const Fault& fault = {});            // a daemon that makes one pass and ends
    std::unique_ptr<test::ChildProcess> startDaemon(char role); // one that stays, and meets no fault
    Ending command(char role, std::vector<std::string> arguments, const Fault& fault = {},
                   const std::string& input = {});
    void edit(char role, const worlds::Habits& habits, const std::string& stamp);
    void edit(char role, const std::function<void(worlds::Editor&)>& work, const std::string& stamp);

    // Everything that people and store hold, under a name; and back to it, as if nothing had happened since.
    void keep(const std::string& name);
    void bringBack(const std::string& name);
    void bringBackHome(const std::string& name, char role); // that person's files alone
    std::string kept(const std::string& name, char role) const {
        return _directory / ("kept/" + name + "/" + std::string(1, role));
    }
    // The store loses files of the owner's tree. They are asked for in the order of their names; the number says how
    // many with the same ending came before.
    void loseFromTree(const std::function<bool(const std::string& file, size_t number)>& isLost);
    // An empty place for a file, of that name.
    std::string scratch(const std::string& name) const;

    worlds::View view(char role) const;
    worlds::View storeView() const;
    // Methods and paths of requests that changed the store, and went well, since the last call.
    std::vector<std::string> writesToTheStore();
    std::vector<std::string> locksOnTheStore() const; // tokens of those on the clock file
    void expireLocks();                               // as five minutes do
    std::string home(char role) const { return _directory / std::string(1, role); }
    std::string databaseOf(char role) const { return home(role) + "/data/rolvane/contacts.db"; }
    std::string userOf(char role) const { return role + _suffix; }
    RemoteLocation locationFor(char role) const;

    void tell(const std::string& line) { _story += line + "\n"; }
    const std::string& story() const { return _story; }
    void forgetStory() { _story.clear(); }
    test::FaultyStore& entrance() { return *_entrance; }
    uint64_t seed() const { return _seed; }
    worlds::Model& model() { return _model; }

private:
    Ending run(char role, std::vector<std::string> arguments, const Fault& fault, const std::string& input);
    HttpResponse ask(char role, const std::string& method, std::vector<std::pair<std::string, std::string>> headers,
                     const std::string& body) const; // about the clock file
    std::vector<std::string> environmentOf(char role) const;
    void begin();

    PrivateStore& _store;
    std::unique_ptr<test::FaultyStore> _entrance;
    std::unique_ptr<TlsEntrance> _tls;
    const std::string _shim;
    const uint64_t _seed;
    const std::string _suffix;
    test::TempDirectory _directory;
    FaultControl* _control = nullptr;
    worlds::Model _model;
    std::map<std::string, worlds::Model> _keptModels;
    std::string _story;
    std::string _password = "open sesame";
    std::string _leftOut; // a part of the programs
    size_t _logRead = 0;  // bytes of the store's log
};

} // namespace rolvane::board
