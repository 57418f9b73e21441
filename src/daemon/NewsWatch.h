#pragma once

#include "daemon/RetrySchedule.h"
#include "foundation/Url.h"
#include "store/reads/StoreNews.h"

#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace rolvane {

// Holds one request at the store that is answered when somebody else has changed a shared tree, and has a pass made
// then. It only ever brings a pass forward: whatever goes wrong with it, the daemon looks by itself as it did before,
// and no pass fails. Main thread. A process that ends when it is idle has none of these.
//
// A new request is made when the last pass has reached the store: at a random moment within kSpread after one that was
// good for a while, else after growing pauses. So a store that is away is not asked by it; when a request that was good
// cannot be made again, one pass finds out whether the store is away, and asks for it as ever.
class NewsWatch {
public:
    static constexpr double kSpread = 5;       // seconds: not all daemons come at once after a restart of the store
    static constexpr double kPassSpread = 0.1; // nor do their passes, after one edit
    static constexpr double kGood = 30;        // a request that has lived as long was a good one
    static constexpr double kFirstPause = 10;  // after a request that was cut off or never began
    static constexpr double kLongestPause = 3600;
    static constexpr double kFirstPauseRefused = 300; // after an answer that says no
    static constexpr double kLongestPauseRefused = 21600;

    class Request { // ends with its object; nothing is told any more then
    public:
        virtual ~Request() = default;
    };
    struct Listener { // called on the main thread, and not before `open` has returned
        std::function<void(const NewsLine&)> line;
        std::function<void(const NewsEnd&)> ended;
    };
    // Everything that it touches. Exists so that tests can replace it.
    struct Collaborators {
        std::function<double()> now; // seconds since the machine was started, time asleep included
        // Calls `wake` at that time, and not at the one given before; none: not at all.
        std::function<void(std::optional<double> at)> wakeAt;
        std::function<double()> random; // from 0 to 1
        std::function<bool()> isWanted; // whether anybody wants to hear of news at all
        // Null: the store does not tell any.
        std::function<std::unique_ptr<Request>(const std::vector<Url>& trees, const std::string& position, Listener)>
            open;
        std::function<void(double spreadSeconds)> news; // somebody has changed something
        std::function<void()> livelinessChanged;        // isLive is another one
    };
    explicit NewsWatch(Collaborators with) : _with(std::move(with)) {}

    // Any pass, and which trees concern this user now.
    void passEnded(const PassResult& pass, std::vector<Url> trees);
    void networkChanged(); // also: the machine has slept. What stands is not to be trusted
    void wake();           // does what is due
    // Whether the store tells of news: a request stands that has begun to be answered, or one has just ended well.
    bool isLive() const { return _live; }

private:
    void arm();
    void open();
    void take(const NewsLine& line);
    void end(const NewsEnd& how);
    void setLive(bool live);
    double pauseAfter(const NewsEnd& how);

    Collaborators _with;
    std::unique_ptr<Request> _request;
    std::vector<Url> _trees;
    std::set<size_t> _refused, _refusedBefore; // trees of which nothing is told
    bool _knowsRefused = false;                // from an earlier request for the same trees
    std::string _position;                     // up to which everything has been told; "" before the first line
    bool _live = false, _reached = false;
    bool _hasBegun = false; // an answer, since the store was last not there
    int _failures = 0;      // in a row
    double _notBefore = 0;
    std::optional<double> _begun; // when the answer of the request began
};

} // namespace rolvane
