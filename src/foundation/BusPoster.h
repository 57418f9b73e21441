#pragma once

#include "foundation/BusConnection.h"
#include "foundation/Mutex.h"
#include "foundation/Notification.h"

namespace rolvane {

// The connection that notifications go out on; it hears nothing. Any thread; one lock around everything, since a
// connection is no good for two threads at a time. A notification is written to the bus's socket before `post` returns,
// unless the bus does not take it: see DistributedNotifications::post.
class BusPoster {
public:
    static constexpr uint64_t kMostQueued = 500;

    explicit BusPoster(std::optional<std::string> address); // connects
    ~BusPoster();                                           // gives what is queued a last, short chance
    BusPoster(const BusPoster&) = delete;
    BusPoster& operator=(const BusPoster&) = delete;

    bool post(const Notification& notification);
    bool connected();
    // Readable when something is queued that `post` could not write: somebody should call `writeQueued` now and then.
    int queuedDescriptor() const { return _queuedDescriptor; }
    bool writeQueued(); // true when nothing is queued any more

private:
    bool connect() REQUIRES(_mutex);
    bool pump() REQUIRES(_mutex);
    bool ready() REQUIRES(_mutex);
    int send(const Notification& notification) REQUIRES(_mutex);
    void watchQueue() REQUIRES(_mutex);

    const std::optional<std::string> _address;
    int _queuedDescriptor;
    Mutex _mutex;
    Bus _bus GUARDED_BY(_mutex);
    std::chrono::steady_clock::time_point _nextAttempt GUARDED_BY(_mutex){}, _nextPump GUARDED_BY(_mutex){};
    bool _stalled GUARDED_BY(_mutex) = false; // the bus takes nothing; nobody waits for it until it does again
};

} // namespace rolvane
