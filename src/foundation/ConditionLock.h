#pragma once

#include "foundation/Date.h"
#include "foundation/Mutex.h"

#include <list>
#include <optional>

namespace rolvane {

// A lock with an integer condition. `lock` takes it whatever the condition is; `lockWhenCondition` waits until it is
// free and the condition has the value. Any thread; released by the thread that took it.
class CAPABILITY("condition lock") ConditionLock {
public:
    explicit ConditionLock(int condition = 0);
    ConditionLock(const ConditionLock&) = delete;
    ConditionLock& operator=(const ConditionLock&) = delete;

    int condition() const; // a glance; may be old when it returns
    void lock() ACQUIRE();
    void lockWhenCondition(int condition) ACQUIRE();
    // False when the time ran out; the lock is then not held. The wait is on the steady clock.
    bool lockWhenCondition(int condition, double timeoutSeconds) TRY_ACQUIRE(true);
    void unlock() RELEASE(); // keeps the condition
    void unlockWithCondition(int condition) RELEASE();

private:
    // A release wakes one of those who wait for what it leaves behind, and nobody who would only look and wait on.
    struct Waiter {
        Condition wake;
        std::optional<int> condition; // none: any
    };
    class Queued;
    bool isFreeFor(const std::optional<int>& condition) const REQUIRES(_mutex) {
        return !_held && (!condition || *condition == _condition);
    }
    void release() REQUIRES(_mutex);

    mutable Mutex _mutex;
    std::list<Waiter*> _waiting GUARDED_BY(_mutex); // the longest wait first
    int _condition GUARDED_BY(_mutex);
    bool _held GUARDED_BY(_mutex) = false;
};

} // namespace rolvane
