#pragma once

#include "engine/pass/PassOutcome.h"

#include <deque>
#include <optional>

namespace rolvane {

// How a pass went, as far as it decides when the next one is due.
struct PassResult {
    bool full = false;            // it looked at every tree; else it carried changes alone
    bool left = false;            // something waits that another pass may carry, or the pass did not come to its end
    bool storeAway = false;       // nobody answered there as a store does
    bool passwordRefused = false; // of something that was left
    double retryAfter = 0;        // seconds that the store asked for; 0: it did not
};
PassResult resultOf(const PassOutcome& outcome);

// When the daemon makes passes on its own, decided from what has happened so far. A value without a clock: every time
// is in seconds since the machine was started, time asleep included.
//
// - After a pass that left something: again after kFirstPause, then after twice the pause each time, up to
// kLongestPause.
//   While the store is away an attempt is one question whether it is there; the pass follows when it is.
// - At once when the network may have come back, or the machine has slept.
// - At most kMostAttempts an hour that meet a store that is away, or that the network causes; then it waits until it is
// an
//   hour since the first of them. An attempt costs two requests at most: the question, and its repetition on a new
//   connection or in another way.
// - Not before the store wants to be asked again (Retry-After), but for kLongestRetryAfter at most.
// - When the store tells of news, as soon as the last pass has ended and a rest of twice its length, kLongestRest at
//   most, is over: while somebody else publishes, the store is not kept busy by readers.
// - Else as soon as the last full pass, whoever wanted it, ended `lookInterval` ago: for other people's news.
class RetrySchedule {
public:
    static constexpr double kFirstPause = 10;
    static constexpr double kLongestPause = 300;
    static constexpr double kAfterRefusedPassword = 900; // as between two warnings
    static constexpr double kLongestRetryAfter = 86400;
    static constexpr double kHour = 3600;
    static constexpr int kMostAttempts = 30;
    static constexpr double kLongestRest = 30;

    enum class What {
        ask,     // whether the store is there; and make a pass when it is
        pass,    // make a full pass
        network, // tell the network store's conduit of the network: it asks, and makes a pass
    };
    struct Next {
        What what;
        double at; // may lie in the past: now
    };
    // None while nothing is due, ever: nothing is left and `lookInterval` is 0.
    std::optional<Next> next(double lookInterval) const;

    void beginsAttempt(double now);                   // one that `next` named, and is made now
    void ended(const PassResult& pass, double now);   // of any pass
    void storeWasAway(double now, double retryAfter); // an attempt asked in vain, and made no pass
    void networkChanged(double now);                  // or the machine has slept
    void newsCame(double at);                         // the store has told of some; a pass not before `at`

private:
    double pause() const;
    double allowedFrom(double now) const;
    void count(double now);

    std::deque<double> _attempts;  // the last kMostAttempts of those that count
    std::optional<double> _failed; // since when the pause goes that is under way; none: nothing is left
    int _failures = 0;             // attempts in a row that left something
    bool _own = false;             // an attempt is under way
    bool _counted = false;         // it is among _attempts
    bool _away = false, _passwordRefused = false;
    double _notBefore = 0;
    std::optional<double> _lastFull, _network;
    std::optional<double> _news;  // since when some wait for a pass
    std::optional<double> _begun; // the attempt that is under way
    double _restsUntil = 0;       // from passes for news
};

} // namespace rolvane
