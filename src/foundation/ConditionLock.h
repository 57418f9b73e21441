#pragma once

#include "foundation/Date.h"

#include <condition_variable>
#include <mutex>

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
    mutable std::mutex _mutex;
    std::condition_variable _changed;
    int _condition;
    bool _held = false;
};

} // namespace rolvane
