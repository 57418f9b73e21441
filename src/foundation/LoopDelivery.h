#pragma once

#include "foundation/DeliveryQueue.h"
#include "foundation/Mutex.h"
#include "foundation/RunLoop.h"

#include <atomic>
#include <deque>
#include <unordered_set>

namespace rolvane {

// The key under which a notification that goes out by several carriers tells which one it is: a text that no other
// notification has. Observers never see it.
inline constexpr const char* kPostIdKey = "postId";

// Which notifications have come already. Remembers the last `kMost` of them. Not locked.
class SeenPosts {
public:
    static constexpr size_t kMost = 20'000;
    static constexpr size_t kLongest = 100; // bytes of an id that is remembered; ours have 57 at most
    bool isNew(const std::string& id);      // true once for each id; always for one that is too long

private:
    std::unordered_set<std::string> _seen;
    std::deque<std::string> _order;
};

// The observers of a distributed centre on their run loop, and what waits for them, by whichever carrier it came. Who
// comes by two of them is delivered once. What has more than kMostBytes is not delivered, whoever sends it. Owned by
// the centre and shared with its carriers.
class LoopDelivery : public std::enable_shared_from_this<LoopDelivery> {
public:
    static constexpr size_t kMostBytes = size_t{1} << 20; // as much as a message on the control socket

    explicit LoopDelivery(RunLoop& loop);
    ~LoopDelivery();
    LoopDelivery(const LoopDelivery&) = delete;
    LoopDelivery& operator=(const LoopDelivery&) = delete;

    // On the loop's thread, but where it says otherwise.
    DeliveryQueue& queue() { return _queue; }
    RunLoop& loop() { return _loop; }
    void setSuspended(bool suspended);
    void arrive(Notification notification);
    void arriveFromAnyThread(Notification notification); // also on the loop's

private:
    bool enqueue(Notification notification);
    void deliverSoon();
    void deliverNext();

    RunLoop& _loop;
    DeliveryQueue _queue;
    std::atomic<bool> _largeLogged = false;
    Mutex _seenMutex;
    SeenPosts _seen GUARDED_BY(_seenMutex);
    bool _suspended = false;
    bool _deliveryScheduled = false;
    int _arrived; // eventfd: another thread has put something into the queue
    RunLoop::Handle _arrivedPort;
};

} // namespace rolvane
