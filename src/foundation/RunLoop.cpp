#include "foundation/RunLoop.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <deque>
#include <unordered_set>

#include <fmt/format.h>
#include <sys/eventfd.h>
#include <systemd/sd-event.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr double kLongestDelay = 10.0 * 365 * 86400;
constexpr double kMicroseconds = 1e6;
constexpr uint64_t kTimerAccuracy = 1;     // 0 would mean sd-event's default of 250 ms
constexpr double kLongestWait = 3600;      // the limit is on the wall clock, which may be set meanwhile
constexpr int kMostDispatchesATurn = 1000; // so that a flooding peer cannot keep handlers from running

uint64_t microseconds(double seconds, double most) {
    return std::isnan(seconds) ? 0 : static_cast<uint64_t>(std::clamp(seconds, 0.0, most) * kMicroseconds);
}

void check(int result, const char* what) {
    if (result < 0)
        throw CXException(kCXInvalidArgumentException,
                          fmt::format("The run loop cannot {}: {}.", what, std::strerror(-result)));
}

struct SourceCloser {
    void operator()(sd_event_source* source) const { sd_event_source_disable_unref(source); }
};
using EventSource = std::unique_ptr<sd_event_source, SourceCloser>;

class Raised {
public:
    explicit Raised(bool& flag) : _flag(flag) { _flag = true; }
    ~Raised() { _flag = false; }

private:
    bool& _flag;
};

} // namespace

struct RunLoop::Impl {
    // One timer, delayed call or port. Held by its handle (delayed calls: by the loop) and, while it is due, by `due`.
    struct Watch : std::enable_shared_from_this<Watch> {
        explicit Watch(std::weak_ptr<Impl> l) : loop(std::move(l)) {}
        std::weak_ptr<Impl> loop;
        std::function<void()> fire;          // timers and delayed calls
        std::function<void(uint32_t)> ready; // ports
        uint32_t events = 0;                 // what the port reported last
        EventSource source;                  // one-shot; a port's is armed again after its handler
        bool ended = false;                  // nobody wants it any more
    };

    struct WatchHandle : Source {
        explicit WatchHandle(std::shared_ptr<Watch> w) : watch(std::move(w)) {}
        ~WatchHandle() override {
            watch->ended = true;
            watch->source.reset();
        }
        std::shared_ptr<Watch> watch;
    };

    Impl();
    ~Impl();

    static int timerElapsed(sd_event_source*, uint64_t, void* watch);
    static int portReady(sd_event_source*, int, uint32_t events, void* watch);
    static int woken(sd_event_source*, int fd, uint32_t, void*);
    void becomeDue(std::shared_ptr<Watch> watch);
    void fireAfter(const std::shared_ptr<Watch>& watch, double seconds);
    void dispatchReady(uint64_t waitMicroseconds);
    void runDueHandlers();
    void runHandler(Watch& watch);
    void turn(double waitSeconds);

    sd_event* event = nullptr;
    int wakeDescriptor = -1;
    EventSource waker;
    std::deque<std::shared_ptr<Watch>> due;
    std::unordered_set<std::shared_ptr<Watch>> delayedCalls; // whose time has not come
    bool inHandler = false;
    bool running = false; // in runUntil
    bool stopRequested = false;
};

RunLoop::Impl::Impl() {
    check(sd_event_new(&event), "be made");
    wakeDescriptor = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    check(wakeDescriptor < 0 ? -errno : 0, "be made");
    sd_event_source* source = nullptr;
    check(sd_event_add_io(event, &source, wakeDescriptor, EPOLLIN, woken, nullptr), "be made");
    waker.reset(source);
}

RunLoop::Impl::~Impl() {
    waker.reset();
    if (wakeDescriptor >= 0) ::close(wakeDescriptor);
    delayedCalls.clear();
    due.clear();
    sd_event_unref(event);
}

int RunLoop::Impl::timerElapsed(sd_event_source*, uint64_t, void* userdata) {
    auto watch = static_cast<Watch*>(userdata)->shared_from_this();
    if (auto loop = watch->loop.lock()) loop->becomeDue(std::move(watch));
    return 0;
}

int RunLoop::Impl::portReady(sd_event_source*, int, uint32_t events, void* userdata) {
    auto watch = static_cast<Watch*>(userdata)->shared_from_this();
    watch->events = events;
    if (auto loop = watch->loop.lock()) loop->becomeDue(std::move(watch));
    return 0;
}

int RunLoop::Impl::woken(sd_event_source*, int fd, uint32_t, void*) {
    eventfd_t ignored;
    ::eventfd_read(fd, &ignored);
    return 0;
}

void RunLoop::Impl::becomeDue(std::shared_ptr<Watch> watch) {
    delayedCalls.erase(watch);
    due.push_back(std::move(watch));
}

void RunLoop::Impl::fireAfter(const std::shared_ptr<Watch>& watch, double seconds) {
    if (!(seconds > 0)) return becomeDue(watch);
    sd_event_source* source = nullptr;
    check(sd_event_add_time_relative(event, &source, CLOCK_MONOTONIC, microseconds(seconds, kLongestDelay),
                                     kTimerAccuracy, timerElapsed, watch.get()),
          "set a timer");
    watch->source.reset(source);
}

// The first half of a turn: takes what is ready from the kernel; no handler runs.
void RunLoop::Impl::dispatchReady(uint64_t waitMicroseconds) {
    int result = sd_event_run(event, waitMicroseconds);
    for (int n = 1; result > 0 && n < kMostDispatchesATurn; ++n) result = sd_event_run(event, 0);
    check(result, "wait for events");
}

// The second half: the handlers that are due by now, not those that become so meanwhile.
void RunLoop::Impl::runDueHandlers() {
    for (size_t left = due.size(); left > 0 && !due.empty() && !stopRequested; --left) {
        auto watch = std::move(due.front());
        due.pop_front();
        if (!watch->ended) runHandler(*watch);
    }
}

void RunLoop::Impl::runHandler(Watch& watch) {
    struct Rearm { // whatever way the handler ends
        Watch& port;
        ~Rearm() {
            if (port.ready && !port.ended) sd_event_source_set_enabled(port.source.get(), SD_EVENT_ONESHOT);
        }
    } rearm{watch};
    Raised handling(inHandler);
    if (watch.ready) return watch.ready(watch.events);
    auto fire = std::move(watch.fire); // once; what it holds ends with the call
    fire();
}

void RunLoop::Impl::turn(double waitSeconds) {
    dispatchReady(due.empty() || inHandler ? microseconds(waitSeconds, kLongestWait) : 0);
    if (!inHandler) runDueHandlers();
}

RunLoop::RunLoop() : _impl(std::make_shared<Impl>()) {}
RunLoop::~RunLoop() = default;

RunLoop& RunLoop::current() {
    static thread_local RunLoop loop;
    return loop;
}

RunLoop::Handle RunLoop::scheduleTimer(double seconds, std::function<void()> fire) {
    auto watch = std::make_shared<Impl::Watch>(_impl);
    watch->fire = std::move(fire);
    _impl->fireAfter(watch, seconds);
    return std::make_unique<Impl::WatchHandle>(std::move(watch));
}

void RunLoop::performAfterDelay(double seconds, std::function<void()> call) {
    auto watch = std::make_shared<Impl::Watch>(_impl);
    watch->fire = std::move(call);
    if (seconds > 0) _impl->delayedCalls.insert(watch);
    _impl->fireAfter(watch, seconds);
}

RunLoop::Handle RunLoop::addPort(int fd, std::function<void(uint32_t)> ready, uint32_t events) {
    auto watch = std::make_shared<Impl::Watch>(_impl);
    watch->ready = std::move(ready);
    sd_event_source* source = nullptr;
    check(sd_event_add_io(_impl->event, &source, fd, events, Impl::portReady, watch.get()), "watch this descriptor");
    watch->source.reset(source);
    check(sd_event_source_set_enabled(source, SD_EVENT_ONESHOT), "watch this descriptor");
    return std::make_unique<Impl::WatchHandle>(std::move(watch));
}

void RunLoop::runUntil(Date limit) {
    auto impl = _impl; // a handler may end the loop's owner
    if (impl->inHandler)
        throw CXException(kCXInvalidArgumentException, "A handler cannot run the run loop that runs it.");
    impl->stopRequested = false;
    Raised serving(impl->running);
    while (!impl->stopRequested) {
        double left = limit.secondsSince(Clock::system().now());
        if (!(left > 0)) break;
        impl->turn(left);
    }
    impl->stopRequested = false;
}

void RunLoop::runOnce(double limitSeconds) {
    auto impl = _impl;
    impl->turn(limitSeconds);
}

void RunLoop::stop() {
    _impl->stopRequested = _impl->running;
}

void RunLoop::wake() {
    ::eventfd_write(_impl->wakeDescriptor, 1);
}

sd_event* RunLoop::event() const {
    return _impl->event;
}

} // namespace rolvane
