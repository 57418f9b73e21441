#include "daemon/BootTimer.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <ctime>
#include <sys/timerfd.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr double kNanoseconds = 1e9;
constexpr double kShortSleep = 5; // seconds; a shorter one leaves connections and networks as they are

timespec timespecOf(double seconds) {
    const double whole = std::floor(seconds);
    return {static_cast<time_t>(whole), static_cast<long>((seconds - whole) * kNanoseconds)};
}

double read(clockid_t clock) {
    timespec now{};
    ::clock_gettime(clock, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / kNanoseconds;
}

void drain(int fd) {
    uint64_t expirations = 0;
    [[maybe_unused]] const ssize_t n =
        ::read(fd, &expirations, sizeof expirations); // ECANCELED for a clock that jumped
}

} // namespace

BootTimer::BootTimer(RunLoop& loop, std::function<void()> fire)
    : _fire(std::move(fire)), _fd(::timerfd_create(CLOCK_BOOTTIME, TFD_CLOEXEC | TFD_NONBLOCK)) {
    if (_fd < 0) return;
    _port = loop.addPort(_fd, [this](uint32_t) {
        drain(_fd);
        _fire();
    });
}

BootTimer::~BootTimer() {
    _port.reset();
    if (_fd >= 0) ::close(_fd);
}

void BootTimer::set(std::optional<double> secondsSinceBoot) {
    itimerspec when{};
    constexpr double kSoonest = 1e-3; // 0 would be never
    if (secondsSinceBoot) when.it_value = timespecOf(std::max(*secondsSinceBoot, kSoonest));
    ::timerfd_settime(_fd, TFD_TIMER_ABSTIME, &when, nullptr);
}

double SleepWatch::secondsSlept() {
    return read(CLOCK_BOOTTIME) - read(CLOCK_MONOTONIC);
}

SleepWatch::SleepWatch(RunLoop& loop, std::function<void()> woken, Slept slept)
    : _woken(std::move(woken)), _slept(std::move(slept)), _before(_slept()),
      _fd(::timerfd_create(CLOCK_REALTIME, TFD_CLOEXEC | TFD_NONBLOCK)) {
    if (_fd < 0) return;
    arm();
    _port = loop.addPort(_fd, [this](uint32_t) {
        drain(_fd);
        arm();
        clockJumped();
    });
}

SleepWatch::~SleepWatch() {
    _port.reset();
    if (_fd >= 0) ::close(_fd);
}

// A timer that is never due, and that the kernel cancels when the clock jumps, as it does at the end of a sleep.
void SleepWatch::arm() const {
    constexpr double kNever = 1e10;
    itimerspec when{};
    when.it_value = timespecOf(kNever);
    ::timerfd_settime(_fd, TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET, &when, nullptr);
}

void SleepWatch::clockJumped() {
    const double slept = _slept();
    const bool woke = slept - _before > kShortSleep;
    _before = slept;
    if (woke) _woken();
}

} // namespace rolvane
