#pragma once

#include "daemon/RetrySchedule.h"

#include <functional>

namespace rolvane {

// Makes the passes that nobody asks for, as RetrySchedule decides. Main thread. A process that ends when it is idle has
// none of these.
class OwnPasses {
public:
    static constexpr const char* kLookIntervalKey = "CXDLookInterval";
    static constexpr double kLookInterval = 300;                    // seconds, unless the preference says otherwise
    static constexpr double kShortestLook = 30;                     // a shorter one is taken for this
    static constexpr double kLookIntervalWithNews = 1800;           // while the store tells of news by itself
    static double lookIntervalOf(std::optional<double> preference); // 0 and less: never
    static double lookIntervalWithNews(double lookInterval);        // the same as long as news come by themselves

    struct Answer {
        bool isThere = false;
        double retryAfter = 0; // seconds; 0: the store did not say
    };
    // Everything that it touches. Exists so that tests can replace it.
    struct Collaborators {
        std::function<double()> now; // seconds since the machine was started, time asleep included
        // Calls `wake` at that time, and not at the one given before; none: not at all.
        std::function<void(std::optional<double> at)> wakeAt;
        std::function<double()> lookInterval;
        // One request: whether the store is there, also when it refuses the password.
        std::function<Answer()> askStore;
        std::function<void()> pass;            // a full pass, now
        std::function<Answer()> networkIsBack; // asks, and makes the pass where the store is there
        // Begins what the next pass would have to wait for long: edits are carried meanwhile. False, and nothing is
        // called, where there is no such thing; else `done` comes on the main thread, later, and always. May be empty.
        std::function<bool(std::function<void()> done)> prepare = {};
    };
    explicit OwnPasses(Collaborators with) : _with(std::move(with)) {}

    void passEnded(const PassResult& pass);
    void networkChanged();               // also: the machine has slept
    void newsCame(double spreadSeconds); // the store tells of some: a pass, but not before
    void lookIntervalChanged();
    void wake(); // does what is due

private:
    void arm();
    void doWhatIsDue(bool prepared);
    bool waitsForPreparation(RetrySchedule::What what) const;
    Collaborators _with;
    RetrySchedule _schedule;
    bool _preparing = false;
};

} // namespace rolvane
