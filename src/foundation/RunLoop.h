#pragma once

#include "foundation/Date.h"

#include <cstdint>
#include <functional>
#include <memory>

struct sd_event;

namespace rolvane {

// A run loop on sd-event. One per thread that asks for it; all but `wake` is called on its own thread.
// Handlers run on the loop's thread, never nested inside one another. A CXException that leaves a handler is logged and
// ends nothing; any other exception leaves `run…` and reaches its caller.
class RunLoop {
public:
    RunLoop();
    ~RunLoop();
    RunLoop(const RunLoop&) = delete;
    RunLoop& operator=(const RunLoop&) = delete;

    static RunLoop& current(); // the calling thread's, made on first use, living as long as the thread

    // An event source that ends with its handle. Owned by the caller; destroyed on the loop's thread.
    class Source {
    public:
        virtual ~Source() = default;
    };
    using Handle = std::unique_ptr<Source>;

    // One-shot timer; destroying the handle invalidates it. `seconds` <= 0 fires at the next turn.
    [[nodiscard]] Handle scheduleTimer(double seconds, std::function<void()> fire);
    // A delayed call that nobody can take back; 0 runs it at the next turn, after the current handler.
    void performAfterDelay(double seconds, std::function<void()> call);
    // A file descriptor that is watched for reading (EPOLLIN) or what `events` says. The descriptor stays the caller's.
    [[nodiscard]] Handle addPort(int fd, std::function<void(uint32_t events)> ready, uint32_t events = 0x001);

    void runUntil(Date limit); // serves until the limit or until `stop`
    void runOnce(
        double limitSeconds); // serves what is ready, waiting at most so long for the first event; one turn at least
    void stop();              // ends the innermost runUntil after the current handler
    void wake();              // any thread: makes a waiting loop turn once
    sd_event* event() const;  // for sd-bus; borrowed

private:
    struct Impl;
    std::unique_ptr<Impl> _impl;
};

} // namespace rolvane
