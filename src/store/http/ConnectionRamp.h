#pragma once

#include <chrono>
#include <optional>

namespace rolvane {

// How many connections a transport may hold to a store that is near: few at first, more as more is asked. A TLS
// handshake costs both ends as much as dozens of small requests, and to a near store it hides no waiting: many small
// passes at the same moment would be nothing but handshakes. Where answers are long on their way, each further
// connection hides some of it, and all are allowed. One thread.
class ConnectionRamp {
public:
    using Steady = std::chrono::steady_clock::time_point;
    using Seconds = std::chrono::duration<double>;

    struct Pace {
        int first = 2;
        int answersForOneMore = 16;
        int answersToJudge = 6;     // how far the store is
        Seconds far{0.01};          // for the quickest answer
        Seconds firstPatience{0.5}; // without an answer while others wait, then one more; twice as long each time
        Seconds longestPatience{8};
    };

    ConnectionRamp(Pace pace, int most)
        : _pace(pace), _most(most), _ramped(pace.first), _patience(pace.firstPatience) {}

    int allowed() const;
    // An answer has come, so long after its request had left.
    void answered(Steady now, Seconds waited);
    // Requests wait for a connection, as seen at this moment: what is under way may hang.
    void othersWait(Steady now);
    // No connection stands any more. How far the store is, stays known.
    void closed();

private:
    const Pace _pace;
    const int _most;
    int _ramped, _answers = 0, _judged = 0;
    std::optional<Seconds> _quickest;
    std::optional<Steady> _moved; // the last answer, or the last connection more
    Seconds _patience;
};

} // namespace rolvane
