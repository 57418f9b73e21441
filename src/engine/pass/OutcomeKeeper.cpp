#include "engine/pass/OutcomeKeeper.h"

#include "foundation/BootTime.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"

#include <utility>

namespace rolvane {

void OutcomeKeeper::begin(bool full, bool retry) {
    const Lock guard(_lock);
    _facts = {};
    _facts.began = _clock.now();
    _facts.beganSinceBoot = secondsSinceBoot();
    _facts.full = full;
    _facts.retry = retry;
    _put.reset();
    _running = true;
    if (_sources.failures) (void)_sources.failures(); // of what was before
    if (_previous) return;
    try {
        _previous = lastOutcome(_preferences);
    } catch (const CXException& e) {
        _facts.storage = e.reason();
    }
}

void OutcomeKeeper::storeWasTested(bool reached, std::optional<PassFailure> why) {
    const Lock guard(_lock);
    _facts.storeReached = reached;
    _facts.storeFailure = reached ? std::nullopt : std::move(why);
}

void OutcomeKeeper::treeWasLookedAt(const UserName& user, TreeLook how) {
    const Lock guard(_lock);
    _facts.looks[user] = how;
}

std::optional<TreeLook> OutcomeKeeper::lookAt(const UserName& user) const {
    const Lock guard(_lock);
    const auto look = _facts.looks.find(user);
    return look == _facts.looks.end() ? std::nullopt : std::optional(look->second);
}

void OutcomeKeeper::tried(const CXDChangeRecord& record) {
    const Lock guard(_lock);
    _facts.counts[record.user().value_or(UserName())].toldToSend = true;
}

void OutcomeKeeper::applied(const CXDChangeRecord& record, int32_t source) {
    const Lock guard(_lock);
    PassFacts::Counts& counts = _facts.counts[record.user().value_or(UserName())];
    ++(source == CXDSyncSourceVaultra ? counts.sent : counts.received);
}

void OutcomeKeeper::refused(const UserName& user) {
    const Lock guard(_lock);
    ++_facts.counts[user].refused;
}

void OutcomeKeeper::rests(const UserName& user, int64_t changes) {
    const Lock guard(_lock);
    _facts.counts[user].resting = changes;
}

void OutcomeKeeper::leaves(const CXDChangeRecords& pending) {
    const Lock guard(_lock);
    countLeftOver(_facts, pending);
}

void OutcomeKeeper::caught(const std::string& exception) {
    const Lock guard(_lock);
    if (!_facts.exception) _facts.exception = exception;
}

void OutcomeKeeper::couldNotStore(const std::string& exception) {
    const Lock guard(_lock);
    if (!_facts.storage) _facts.storage = exception;
}

// The failures are taken: a second call adds those that came since.
void OutcomeKeeper::collect() {
    _facts.anotherFollows = _sources.anotherFollows && _sources.anotherFollows();
    try {
        if (_sources.failures)
            for (PassFailure& failure : _sources.failures()) _facts.failures.push_back(std::move(failure));
        if (_sources.shared) _facts.shared = _sources.shared();
    } catch (const CXException& e) {
        if (!_facts.storage) _facts.storage = e.reason();
    }
}

void OutcomeKeeper::put() {
    const Lock guard(_lock);
    collect();
    _put = outcomeOf(_facts, _previous, _clock.now());
    _preferences.set(kDaemonDomain, kCXDPassOutcome, encodeOutcome(*_put));
}

PassOutcome OutcomeKeeper::end() {
    const Lock guard(_lock);
    _running = false;
    collect();
    PassOutcome outcome = outcomeOf(_facts, _previous, _put ? _put->ended : _clock.now());
    try {
        if (_put != outcome) {
            _preferences.set(kDaemonDomain, kCXDPassOutcome, encodeOutcome(outcome));
            _preferences.synchronize(kDaemonDomain);
        }
    } catch (const CXException& e) {
        // Where the same has ended the pass, it stands in the log already.
        if (outcome.exception != e.reason()) CXLog("The outcome of the pass could not be stored: %@", e);
        if (!outcome.storage) outcome.storage = e.reason();
    }
    _previous = outcome;
    return outcome;
}

PassOutcome OutcomeKeeper::endWithoutAPass(Preferences& preferences, const Clock& clock, const std::string& exception) {
    OutcomeKeeper keeper(preferences, clock, {});
    keeper.begin(true, false);
    keeper.caught(exception);
    return keeper.end();
}

} // namespace rolvane
