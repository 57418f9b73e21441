#pragma once

#include "foundation/Date.h"

#include <cstdint>
#include <functional>
#include <memory>

struct sd_event;

namespace rolvane {

// A run loop on sd-event. One per thread that asks for it; all but `wake` is called on its own thread.
// Handlers run on the loop's thread, never nested inside one another. An exception that leaves a handler leaves `run…`
// and reaches its caller; the loop can be run again, and what was due stays due.
//
// A turn has two halves. First sd-event dispatches what is ready: connections attached to `event` move their bytes,
// timers and ports only note that their handler is due. Then the handlers that are due run, in the order in which they
// became so, outside sd-event; what they make due (delayed calls of 0 seconds) waits for the next turn. That is why a
// handler may call `runOnce`: inside a handler it performs the first half only. Bytes go out and come in; handlers that
// become due run after the current one has returned.
class RunLoop {
public:
    RunLoop();
    ~RunLoop();
    RunLoop(const RunLoop&) = delete;
    RunLoop& operator=(const RunLoop&) = delete;

    static RunLoop& current(); // the calling thread's, made on first use, living as long as the thread

    // An event source that ends with its handle: once the handle is destroyed the handler is not called again, not even
    // when it was due. Owned by the caller; destroyed on the loop's thread, within its own handler too, and also after
    // the loop.
    class Source {
    public:
        virtual ~Source() = default;
    };
    using Handle = std::unique_ptr<Source>;

    // One-shot timer; destroying the handle invalidates it. `seconds` <= 0 fires at the next turn. Time asleep
    // (suspend) does not count.
    [[nodiscard]] Handle scheduleTimer(double seconds, std::function<void()> fire);
    // A delayed call that nobody can take back; 0 runs it at the next turn, after the current handler.
    void performAfterDelay(double seconds, std::function<void()> call);
    // A file descriptor that is watched for reading (EPOLLIN) or what `events` says; EPOLLERR and EPOLLHUP are reported
    // whatever it says, with 0 nothing but these. Level-triggered: a handler that neither reads what is there nor ends
    // its source when the peer has closed is called again at every turn. The descriptor stays the caller's, and stays
    // open until the handle is destroyed. CXException for what cannot be watched (a regular file, a descriptor watched
    // twice).
    [[nodiscard]] Handle addPort(int fd, std::function<void(uint32_t events)> ready, uint32_t events = 0x001);

    void runUntil(Date limit); // serves until the limit or until `stop`; CXException when called inside a handler
    // Serves what is ready, waiting at most so long for the first event; one turn at least. Inside a handler: see
    // above.
    void runOnce(double limitSeconds);
    void stop();             // ends the current runUntil after the current handler; without one nothing happens
    void wake();             // any thread: makes a waiting loop turn once
    sd_event* event() const; // for sd-bus; borrowed. Callbacks of sd-event itself must not run handlers nor throw:
                             // they use performAfterDelay(0, …)

private:
    struct Impl;
    std::shared_ptr<Impl> _impl;
};

} // namespace rolvane
