#pragma once

#include "Daemon.h"
#include "server/PrivateStore.h"

#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace rolvane::worlds {

// What a run leaves out, to find out what a difference depends on.
struct Options {
    std::set<std::string>
        without;         // "kills", "faults", "outages", "disks", "refusals", "nesting", "writer", "overlap", "merging"
    bool second = false; // the owner has two computers
    int steps = 0;       // 0: as the seed says
    std::string keep;    // directory for the files and the story of worlds that end with a difference
    bool keepAll = false;
    bool copies = false; // everybody's database and the tree as each pass leaves them, among what is kept
};

// What a world really had, and how it ended.
struct Outcome {
    uint64_t seed = 0;
    size_t edits = 0, passes = 0, kills = 0, faults = 0, away = 0, diskFailures = 0, refusals = 0, exceptions = 0,
           conflicts = 0, cleanPasses = 0, restored = 0, sideBySide = 0;
    double seconds = 0;
    std::vector<std::string> differences;
};

// Three people around one tree: the owner, one who may write, one who may read. Each step is a process of one of them,
// over the same files as the one before: edits at a contact application, or a daemon that makes passes. The seed
// decides what happens; in the end all is well again, each makes up to three passes, and everybody's copy, the store
// and the model must be equal.
//
// With a second computer ('s') the owner joins with it in one of the first steps. From then on both edit, their daemons
// also run at the same time, rights change on both, and older databases and homes are put back. Where two daemons run
// at once, what happens depends on more than the seed.
class World {
public:
    World(PrivateStore& store, uint64_t seed, Options options);
    ~World();
    Outcome run();

private:
    struct Climate {
        size_t people = 6, groups = 3, steps = 24;
        Habits habits;
        double faults = 0, kills = 0, outages = 0, fullDisks = 0, overlaps = 0;
        bool refusals = false;
    };
    Climate climateOf(Chance& chance) const;
    bool with(const char* what) const { return !_options.without.contains(what); }
    Person& person(char role);
    std::vector<char> roles() const; // whoever takes part by now
    char selfOf(char role) const;    // whom the model takes it for

    using Work = std::function<void(Report&)>;
    struct Job {
        char who;
        Work work;
    };
    void inProcess(const std::string& what, char who, const Work& work, View* view = nullptr);
    void inProcesses(const std::string& what, const std::vector<Job>& jobs, View* view = nullptr); // at the same time
    void take(char who, const std::string& line, View* view);
    void settle();
    void begin();
    void step(size_t number);
    struct Service {
        char role;
        uint64_t seed;
        Weather weather;
    };
    void serve(std::vector<Service> services, const std::string& stamp);

    // The second computer.
    void makeSecondComputer();
    void beginSecondComputer();
    bool hasStepOfItsOwn(const std::string& stamp); // true: one was made
    void join();
    void keep(char role);
    void putBack(char role);
    void changeRights(char role);
    std::vector<std::string> wrongRights();
    std::string readerOf(char role); // somebody who is given and refused the right to read by that computer alone
    Weather weather();
    void clean(char role);
    void edit(char who, const std::string& stamp, uint64_t seed, Report& report);
    void live(char role, const std::string& stamp, const Weather& weather, uint64_t seed, Report& report);
    View viewOf(char role);
    std::vector<std::string> compareAll();
    void tell(const std::string& text);
    void copyAll(const std::string& moment);

    PrivateStore& _store;
    const uint64_t _seed;
    const Options _options;
    Chance _chance;
    const Climate _climate;
    std::string _directory;
    std::vector<Person> _people;
    Model _model;
    Outcome _outcome;
    std::vector<std::string> _wrong, _wrote; // what processes told
    bool _settling = false;                  // all is well again
    bool _afterRest = false;                 // clean daemons live an hour later
    size_t _joinsAt = 0;                     // step; 0: never
    bool _hasJoined = false;
    std::map<char, char> _selves; // role -> whom the model takes it for, once a former state was put back
    std::set<char> _settled;      // roles of which a pass has ended without anything left
    struct NotSent {
        std::vector<Deed> deeds;
        bool rights = false;
    };
    std::map<char, NotSent> _kept; // the computers with a former state that can be put back: what was not sent in it
    std::set<char> _rightsToSend;  // roles that changed rights since their last settling
    std::map<char, std::optional<bool>> _mayRead; // whom that computer alone gives and takes the right; none: unsure
    int _log = -1;
    size_t _processes = 0;
};

} // namespace rolvane::worlds
