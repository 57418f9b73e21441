#include "daemon/NewsWatch.h"

#include "foundation/Log.h"

#include <algorithm>
#include <cmath>
#include <utility>

namespace rolvane {

namespace {
constexpr int kUnauthorized = 401;
}

void NewsWatch::passEnded(const PassResult& pass, std::vector<Url> trees) {
    _reached = !pass.storeAway && !pass.passwordRefused;
    if (trees != _trees) { // not the request's fault
        _trees = std::move(trees);
        _request.reset();
        _begun.reset();
        _refusedBefore.clear();
        _knowsRefused = false;
    }
    arm();
}

void NewsWatch::networkChanged() {
    _request.reset();
    _begun.reset();
    _reached = false; // until a pass, which the change of the network brings about, has found the store
    arm();
}

void NewsWatch::wake() {
    arm();
}

void NewsWatch::arm() {
    const bool wanted = _reached && !_trees.empty() && _with.isWanted();
    if (_request && !_with.isWanted()) _request.reset();
    if (!wanted && !_request) setLive(false);
    if (_request || !wanted) return _with.wakeAt(std::nullopt);
    if (_notBefore > _with.now()) return _with.wakeAt(_notBefore);
    _with.wakeAt(std::nullopt);
    open();
}

void NewsWatch::open() {
    _begun.reset();
    _refused.clear();
    _request = _with.open(_trees, _position,
                          {[this](const NewsLine& line) { take(line); }, [this](const NewsEnd& how) { end(how); }});
    if (!_request) setLive(false);
}

void NewsWatch::take(const NewsLine& line) {
    if (!line.position.empty()) _position = line.position;
    switch (line.kind) {
    case NewsLine::Kind::begin:
        CXDLog("The store tells of news from now on.");
        _begun = _with.now();
        _hasBegun = true;
        setLive(true);
        return;
    case NewsLine::Kind::no:
        _refused.insert(line.tree);
        // A right that has gone meanwhile is news as well. The pass finds out about it.
        if (_knowsRefused && !_refusedBefore.contains(line.tree)) _with.news(_with.random() * kPassSpread);
        return;
    case NewsLine::Kind::news: return _with.news(_with.random() * kPassSpread);
    case NewsLine::Kind::still: return;
    }
}

double NewsWatch::pauseAfter(const NewsEnd& how) {
    const double lived = _begun ? _with.now() - *_begun : 0;
    if (lived >= kGood) {
        _failures = 0;
        return _with.random() * kSpread;
    }
    const bool refused = how.status >= 400;
    const double first = refused ? kFirstPauseRefused : kFirstPause;
    const double longest = refused ? kLongestPauseRefused : kLongestPause;
    constexpr int kDoublings = 20; // by then it is the longest
    const double pause = std::min(longest, first * std::exp2(std::min(_failures++, kDoublings)));
    return pause * (1 + _with.random() / 4);
}

void NewsWatch::end(const NewsEnd& how) {
    _request.reset();
    if (_begun) {
        _refusedBefore = _refused;
        _knowsRefused = true;
    }
    const double pause = pauseAfter(how);
    CXDLog("The store tells of no news any more (%s); it is asked again in %d seconds.",
           how.whole    ? "it has ended the answer"
           : how.status ? std::to_string(how.status)
                        : how.detail,
           static_cast<int>(pause));
    const bool good = std::exchange(_begun, std::nullopt).has_value();
    // Nobody answered, or the password is refused: the next pass finds out more.
    if (!good && (how.status == 0 || how.status == kUnauthorized)) _reached = false;
    if (!good || _failures > 0) setLive(false);
    if (!good && how.status == 0 && std::exchange(_hasBegun, false)) _with.news(_with.random() * kSpread);
    _notBefore = _with.now() + pause;
    arm();
}

void NewsWatch::setLive(bool live) {
    if (std::exchange(_live, live) != live) _with.livelinessChanged();
}

} // namespace rolvane
