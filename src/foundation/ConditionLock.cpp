#include "foundation/ConditionLock.h"

#include "foundation/Mutex.h"

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
    Lock guard(_mutex);
    return _condition;
}

// In the queue for as long as it lives. With the mutex held.
class ConditionLock::Queued {
public:
    Queued(ConditionLock& lock, std::optional<int> condition)
        : waiter{{}, condition}, _waiting(lock._waiting), _place(_waiting.insert(_waiting.end(), &waiter)) {}
    ~Queued() { _waiting.erase(_place); }
    Queued(const Queued&) = delete;
    Queued& operator=(const Queued&) = delete;

    Waiter waiter;

private:
    std::list<Waiter*>& _waiting;
    const std::list<Waiter*>::iterator _place;
};

void ConditionLock::lock() {
    Lock guard(_mutex);
    if (_held) {
        Queued queued(*this, std::nullopt);
        queued.waiter.wake.wait(guard, [&]() REQUIRES(_mutex) { return !_held; });
    }
    _held = true;
}

void ConditionLock::lockWhenCondition(int condition) {
    Lock guard(_mutex);
    if (!isFreeFor(condition)) {
        Queued queued(*this, condition);
        queued.waiter.wake.wait(guard, [&]() REQUIRES(_mutex) { return isFreeFor(condition); });
    }
    _held = true;
}

bool ConditionLock::lockWhenCondition(int condition, double timeoutSeconds) {
    Lock guard(_mutex);
    if (!isFreeFor(condition)) {
        Queued queued(*this, condition);
        if (!queued.waiter.wake.wait_until(guard, deadlineAfter(timeoutSeconds),
                                           [&]() REQUIRES(_mutex) { return isFreeFor(condition); }))
            return false;
    }
    _held = true;
    return true;
}

// Who was woken but finds that somebody came in between waits on, and the release of that one wakes again. The mutex is
// held while notifying: the one who wakes may destroy the lock.
void ConditionLock::release() {
    _held = false;
    for (Waiter* waiter : _waiting) {
        if (!isFreeFor(waiter->condition)) continue;
        waiter->wake.notify_one();
        return;
    }
}

void ConditionLock::unlock() {
    Lock guard(_mutex);
    release();
}

void ConditionLock::unlockWithCondition(int condition) {
    Lock guard(_mutex);
    _condition = condition;
    release();
}

} // namespace rolvane
