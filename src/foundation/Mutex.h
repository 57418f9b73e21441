#pragma once

#include <condition_variable>
#include <mutex>

// Declarations of mutexes and the members that they guard. Lint lets clang check them (packaging/lint/run): a member
// that is GUARDED_BY a mutex is only read and written while that is held, and a function that REQUIRES one is only
// called so. Other compilers ignore them. The analysis follows no pointers: where an object hands its mutex out, or a
// lock travels, NO_THREAD_SAFETY_ANALYSIS stands with the reason.
#if defined(__clang__)
#define ROLVANE_THREAD_SAFETY(attribute) __attribute__((attribute))
#else
#define ROLVANE_THREAD_SAFETY(attribute)
#endif
#define GUARDED_BY(mutex) ROLVANE_THREAD_SAFETY(guarded_by(mutex))
#define REQUIRES(...) ROLVANE_THREAD_SAFETY(requires_capability(__VA_ARGS__))
#define CAPABILITY(kind) ROLVANE_THREAD_SAFETY(capability(kind)) // of a class that is a mutex
#define ACQUIRE(...) ROLVANE_THREAD_SAFETY(acquire_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...)                                                                                               \
    ROLVANE_THREAD_SAFETY(try_acquire_capability(__VA_ARGS__)) // the result first that means success
#define RELEASE(...) ROLVANE_THREAD_SAFETY(release_capability(__VA_ARGS__))
#define NO_THREAD_SAFETY_ANALYSIS ROLVANE_THREAD_SAFETY(no_thread_safety_analysis)

namespace rolvane {

// A standard mutex that the analysis knows. Standard locks of it are not seen; Lock is.
template <class Standard>
class CAPABILITY("mutex") BasicMutex {
public:
    void lock() ACQUIRE() { _standard.lock(); }
    void unlock() RELEASE() { _standard.unlock(); }
    bool try_lock() TRY_ACQUIRE(true) { return _standard.try_lock(); }

private:
    Standard _standard;
};
using Mutex = BasicMutex<std::mutex>;
using RecursiveMutex = BasicMutex<std::recursive_mutex>;

// Holds a mutex from its making to its end, but for the time between `unlock` and `lock`. One thread.
template <class Held>
class ROLVANE_THREAD_SAFETY(scoped_lockable) BasicLock {
public:
    explicit BasicLock(Held& mutex) ACQUIRE(mutex) : _mutex(mutex) { lockIt(); }
    ~BasicLock() RELEASE() {
        if (_holds) _mutex.unlock();
    }
    BasicLock(const BasicLock&) = delete;
    BasicLock& operator=(const BasicLock&) = delete;

    void lock() ACQUIRE() { lockIt(); }
    void unlock() RELEASE() {
        _holds = false;
        _mutex.unlock();
    }

private:
    void lockIt() NO_THREAD_SAFETY_ANALYSIS {
        _mutex.lock();
        _holds = true;
    }
    Held& _mutex;
    bool _holds = false;
};
using Lock = BasicLock<Mutex>;
using RecursiveLock = BasicLock<RecursiveMutex>;

// Waits with a Lock. `holds`: a lambda that REQUIRES the mutex, where it looks at what that guards.
using Condition = std::condition_variable_any;

} // namespace rolvane
