#pragma once

#include "store/http/HttpTransport.h"

#include <chrono>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>

namespace rolvane {

// True for methods whose repetition leaves the server as one request does: those that RFC 9110 section 9.2.2, RFC 4918
// section 9 and RFC 3744 section 8.1 call idempotent; and LOCK, whose second try meets at worst the lock of the first.
bool mayBeSentTwice(std::string_view method);

// The seconds after which a server closes a connection that nobody uses, as it says itself ("Keep-Alive: timeout=5");
// nothing when it does not say.
std::optional<int> keepAliveSeconds(const HttpResponse& answer);

// Says which kept connections are worth a request. A server closes them after its own time; a machine that has slept or
// changed its network holds connections that are dead without a word. One thread.
class KeptConnections {
public:
    using Steady = std::chrono::steady_clock::time_point;
    // Seconds that the machine has spent asleep since its start.
    using SecondsAsleep = std::function<double()>;
    static double secondsAsleep(); // the machine's own

    static constexpr int kLongest = 30; // seconds without use; whatever the server says
    static constexpr int kMargin = 2;   // seconds left to the server's own time

    explicit KeptConnections(SecondsAsleep asleep = secondsAsleep) : _asleep(std::move(asleep)), _slept(_asleep()) {}

    // What the server says of its time is heeded.
    void heard(const std::string& origin, const HttpResponse& answer);
    // A connection to there was dead: others that are as old are as well.
    void foundDead(const std::string& origin, Steady now) { _deadBefore[origin] = now; }
    // True once after the machine has slept for more than a second: no connection is to be used again.
    bool hasSlept();
    // How many whole seconds a connection may have been without use, at most.
    int longestIdle(const std::string& origin, Steady now) const;

private:
    const SecondsAsleep _asleep;
    double _slept;
    std::map<std::string, int> _promised;
    std::map<std::string, Steady> _deadBefore;
};

} // namespace rolvane
