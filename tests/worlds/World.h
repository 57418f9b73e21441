#pragma once

#include "Daemon.h"
#include "server/PrivateStore.h"

#include <functional>
#include <set>
#include <string>
#include <vector>

namespace rolvane::worlds {

// What a run leaves out, to find out what a difference depends on.
struct Options {
    std::set<std::string>
        without;      // "kills", "faults", "outages", "disks", "refusals", "nesting", "writer", "overlap", "merging"
    int steps = 0;    // 0: as the seed says
    std::string keep; // directory for the files and the story of worlds that end with a difference
    bool keepAll = false;
    bool copies = false; // everybody's database and the tree as each pass leaves them, among what is kept
};

// What a world really had, and how it ended.
struct Outcome {
    uint64_t seed = 0;
    size_t edits = 0, passes = 0, kills = 0, faults = 0, away = 0, diskFailures = 0, refusals = 0, exceptions = 0,
           conflicts = 0, cleanPasses = 0;
    double seconds = 0;
    std::vector<std::string> differences;
};

// Three people around one tree: the owner, one who may write, one who may read. Each step is a process of one of them,
// over the same files as the one before: edits at a contact application, or a daemon that makes passes. The seed
// decides what happens; in the end all is well again, each makes up to three passes, and everybody's copy, the store
// and the model must be equal.
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
    Person& person(char role) { return _people[role == 'o' ? 0 : role == 'w' ? 1 : 2]; }

    using Work = std::function<void(Report&)>;
    void inProcess(const std::string& what, char who, const Work& work, View* view = nullptr);
    void take(char who, const std::string& line, View* view);
    void settle();
    void begin();
    void step(size_t number);
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
    int _log = -1;
    size_t _processes = 0;
};

} // namespace rolvane::worlds
