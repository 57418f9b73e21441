#pragma once

#include "engine/pass/PassFacts.h"
#include "foundation/Mutex.h"
#include "foundation/Preferences.h"

#include <functional>
#include <optional>
#include <string>

namespace rolvane {

// Collects what happens in a pass and puts its outcome down, once, with the other values that are stored at the end of
// the pass. Main thread, but for the functions that say otherwise.
class OutcomeKeeper {
public:
    // What is asked at the end of a pass. Either may throw CXException: then the outcome says so.
    struct Sources {
        std::function<std::optional<std::vector<PassFacts::Shared>>()> shared;
        std::function<std::vector<PassFailure>()> failures;
        std::function<bool()> anotherFollows;
    };
    OutcomeKeeper(Preferences& preferences, const Clock& clock, Sources sources)
        : _preferences(preferences), _clock(clock), _sources(std::move(sources)) {}

    void begin(bool full, bool retry);
    bool running() const { return _running; }

    void storeWasTested(bool reached, std::optional<PassFailure> why);
    void treeWasLookedAt(const UserName& user, TreeLook how);
    std::optional<TreeLook> lookAt(const UserName& user) const; // in this pass; none: there was none
    // A record that a source has taken, was asked to take, or was refused for. Any thread.
    void applied(const CXDChangeRecord& record, int32_t source);
    void tried(const CXDChangeRecord& record);
    void refused(const UserName& user);
    // How many changes a store has refused, in this pass or earlier, that are to be made anew later.
    void rests(const UserName& user, int64_t changes);
    // What waits after the pass. Once a pass.
    void leaves(const CXDChangeRecords& pending);
    void caught(const std::string& exception); // the first one counts. Any thread.
    void couldNotStore(const std::string& exception);

    // Sets the value in the preferences, without synchronising.
    void put();
    // The pass has ended. What has changed since `put`, or was never put, is stored now. Any thread.
    PassOutcome end();

    // For a process that came to no pass: puts down and gives an outcome that says why.
    static PassOutcome endWithoutAPass(Preferences& preferences, const Clock& clock, const std::string& exception);

private:
    void collect() REQUIRES(_lock);

    Preferences& _preferences;
    const Clock& _clock;
    Sources _sources;
    bool _running = false;
    mutable Mutex _lock;
    PassFacts _facts GUARDED_BY(_lock);
    std::optional<PassOutcome> _previous; // of this process, stored or not
    std::optional<PassOutcome> _put;
};

} // namespace rolvane
