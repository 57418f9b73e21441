#include "foundation/ConditionLock.h"

#include <algorithm>
#include <chrono>
#include <cmath>

namespace rolvane {

namespace {

// Far enough for every caller, near enough for the clock's arithmetic.
constexpr double kLongestWait = 10.0 * 365 * 86400;

std::chrono::steady_clock::time_point deadlineAfter(double seconds) {
    if (std::isnan(seconds) || seconds < 0) seconds = 0;
    std::chrono::duration<double> wait(std::min(seconds, kLongestWait));
    return std::chrono::steady_clock::now() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(wait);
}

} // namespace

ConditionLock::ConditionLock(int condition) : _condition(condition) {}

int ConditionLock::condition() const {
    std::lock_guard guard(_mutex);
    return _condition;
}

void ConditionLock::lock() {
    std::unique_lock guard(_mutex);
    _changed.wait(guard, [&] { return !_held; });
    _held = true;
}

void ConditionLock::lockWhenCondition(int condition) {
    std::unique_lock guard(_mutex);
    _changed.wait(guard, [&] { return !_held && _condition == condition; });
    _held = true;
}

bool ConditionLock::lockWhenCondition(int condition, double timeoutSeconds) {
    std::unique_lock guard(_mutex);
    if (!_changed.wait_until(guard, deadlineAfter(timeoutSeconds), [&] { return !_held && _condition == condition; }))
        return false;
    _held = true;
    return true;
}

void ConditionLock::unlock() {
    std::lock_guard guard(_mutex); // held while notifying: the one who wakes may destroy the lock
    _held = false;
    _changed.notify_all();
}

void ConditionLock::unlockWithCondition(int condition) {
    std::lock_guard guard(_mutex);
    _condition = condition;
    _held = false;
    _changed.notify_all();
}

} // namespace rolvane
