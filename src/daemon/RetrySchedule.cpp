#include "daemon/RetrySchedule.h"

#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <cmath>
#include <utility>

namespace rolvane {

namespace {

constexpr int kUnauthorized = 401;

// What was refused is not left: another pass would be refused as well. The next look at the database brings it again.
bool isLeft(const PassTree& tree) {
    const bool unread = tree.in.waitingSince && !tree.leftAlone; // the latter waits for its owner's daemon
    return tree.out.waiting > 0 || tree.listsWait || (unread && !tree.ended);
}

void take(PassResult& result, const std::optional<PassFailure>& why) {
    if (!why) return;
    result.retryAfter = std::max(result.retryAfter, why->retryAfterSeconds.value_or(0));
    result.passwordRefused =
        result.passwordRefused || why->status == kUnauthorized || why->error == kCXDAVErrorAuthentication;
}

} // namespace

PassResult resultOf(const PassOutcome& outcome) {
    PassResult result;
    result.full = outcome.full;
    result.storeAway = !outcome.storeReached && outcome.storeFailure;
    result.left = !isComplete(outcome) || result.storeAway;
    take(result, outcome.storeFailure);
    for (const PassTree& tree : outcome.trees) {
        if (!isLeft(tree)) continue;
        result.left = true;
        take(result, tree.out.why);
        take(result, tree.in.why);
    }
    return result;
}

double RetrySchedule::pause() const {
    if (_passwordRefused) return kAfterRefusedPassword;
    constexpr int kDoublings = 10; // by then it is the longest
    return std::min(kLongestPause, kFirstPause * std::exp2(std::clamp(_failures - 1, 0, kDoublings)));
}

// The first moment at which one more attempt is not one too many of its hour, and the store wants to be asked.
double RetrySchedule::allowedFrom(double now) const {
    const bool full = _attempts.size() == kMostAttempts;
    return std::max({now, _notBefore, full ? _attempts.front() + kHour : 0});
}

std::optional<RetrySchedule::Next> RetrySchedule::next(double lookInterval) const {
    std::optional<Next> first;
    const auto consider = [&](What what, double at) {
        if (!first || at < first->at) first = Next{what, at};
    };
    if (_network) consider(What::network, allowedFrom(*_network));
    if (_failed) consider(_away ? What::ask : What::pass, allowedFrom(*_failed + pause()));
    if (lookInterval > 0 && _lastFull && !_away) consider(What::pass, allowedFrom(*_lastFull + lookInterval));
    if (_news && !_away) consider(What::pass, allowedFrom(std::max(*_news, _restsUntil)));
    return first;
}

void RetrySchedule::beginsAttempt(double now) {
    _own = true;
    _begun = now;
    _news.reset();              // what comes from now on may come too late for it
    if (_failed) _failed = now; // should it lead to no pass after all, the next one is due after the pause
    if (_lastFull) _lastFull = now;
    _counted = _away || _network;
    _network.reset();
    if (_counted) count(now);
}

void RetrySchedule::count(double now) {
    _attempts.push_back(now);
    if (_attempts.size() > kMostAttempts) _attempts.pop_front();
}

// Attempts of the schedule's own make the pause longer; an edit in between, or somebody's command, does not.
void RetrySchedule::ended(const PassResult& pass, double now) {
    const bool own = std::exchange(_own, false);
    if (const auto begun = std::exchange(_begun, std::nullopt))
        _restsUntil = now + std::clamp(2 * (now - *begun), 0.0, kLongestRest);
    if (own && pass.storeAway && !_counted) count(now);
    _away = pass.storeAway;
    _passwordRefused = pass.left && pass.passwordRefused;
    if (pass.full) _lastFull = now;
    if (pass.retryAfter > 0) _notBefore = std::max(_notBefore, now + std::min(pass.retryAfter, kLongestRetryAfter));
    if (!pass.left && !pass.storeAway) {
        _failures = 0;
        _failed.reset();
    } else if (own || !_failed) {
        ++_failures;
        _failed = now;
    }
}

void RetrySchedule::storeWasAway(double now, double retryAfter) {
    PassResult away;
    away.left = away.storeAway = true;
    away.retryAfter = retryAfter;
    ended(away, now);
}

void RetrySchedule::newsCame(double at) {
    _news = _news ? std::min(*_news, at) : at;
}

void RetrySchedule::networkChanged(double now) {
    if (!_network) _network = now;
}

} // namespace rolvane
