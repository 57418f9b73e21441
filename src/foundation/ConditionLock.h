#pragma once

#include "foundation/Date.h"

#include <condition_variable>
#include <list>
#include <mutex>
#include <optional>

namespace rolvane {

// A lock with an integer condition. `lock` takes it whatever the condition is; `lockWhenCondition` waits until it is
// free and the condition has the value. Any thread; released by the thread that took it.
class ConditionLock {
public:
    explicit ConditionLock(int condition = 0);
    ConditionLock(const ConditionLock&) = delete;
    ConditionLock& operator=(const ConditionLock&) = delete;

    int condition() const; // a glance; may be old when it returns
    void lock();
    void lockWhenCondition(int condition);
    // False when the time ran out; the lock is then not held. The wait is on the steady clock.
    bool lockWhenCondition(int condition, double timeoutSeconds);
    void unlock(); // keeps the condition
    void unlockWithCondition(int condition);

private:
    // A release wakes one of those who wait for what it leaves behind, and nobody who would only look and wait on.
    struct Waiter {
        std::condition_variable wake;
        std::optional<int> condition; // none: any
    };
    class Queued;
    bool isFreeFor(const std::optional<int>& condition) const {
        return !_held && (!condition || *condition == _condition);
    }
    void release();

    mutable std::mutex _mutex;
    std::list<Waiter*> _waiting; // the longest wait first
    int _condition;
    bool _held = false;
};

} // namespace rolvane
