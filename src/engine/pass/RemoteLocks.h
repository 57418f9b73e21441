#pragma once

#include "foundation/ConditionLock.h"
#include "foundation/Date.h"
#include "foundation/Mutex.h"
#include "foundation/Url.h"
#include "store/locks/CXWebDAVLock.h"

#include <atomic>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace rolvane {

// How the renewal thread sleeps. Exists so that tests can replace it.
class InterruptibleSleep {
public:
    virtual ~InterruptibleSleep() = default;
    // True when the time ran out, false when it was interrupted. An interruption that came before counts, once.
    virtual bool sleep(double seconds) = 0;
    virtual void interrupt() = 0; // any thread
};
std::unique_ptr<InterruptibleSleep> makeInterruptibleSleep(); // on the steady clock

// The locks that the engine holds on published trees: taken on first need, renewed 30 seconds before they expire by a
// thread of its own, released together at the end of a pass. A lock is in the list from the moment it is made, even
// when taking it failed, until unlockAllURLs or a failed renewal takes it out; so only the first record of a pass pays
// for a lock that cannot be had. Any thread. Requests to the store are made outside the lock of the list.
class RemoteLocks {
public:
    RemoteLocks(LockFactory makeLock, const Clock& clock,
                std::unique_ptr<InterruptibleSleep> sleep = makeInterruptibleSleep());
    ~RemoteLocks(); // stops renewing; what is still held is left to expire
    RemoteLocks(const RemoteLocks&) = delete;
    RemoteLocks& operator=(const RemoteLocks&) = delete;

    // What is locked for a URL: on the store the "dateFile" beside the "Contacts" folder of its tree, elsewhere the URL
    // itself. Nothing for a store URL outside of any tree.
    static std::optional<Url> lockTarget(const Url& url);

    // True when the lock is held or in the list already; false when the store refused it now. Who asks while another
    // thread is still taking the lock waits for that attempt to end.
    bool lockURL(const Url& url);
    void unlockAllURLs();

    void startRenewing();  // once
    void stopRenewing();   // waits for the thread; a renewal under way is finished first
    size_t count() const;  // locks in the list
    int condition() const; // 1 while the list is not empty, else 0

private:
    struct Held {
        std::shared_ptr<CXWebDAVLock> lock;
        std::string key;
        std::shared_future<void> tried; // ready when the attempt to take it is over
    };
    void renewLocks();
    void renewOnce(std::shared_ptr<CXWebDAVLock>& renewedLast);
    void unlockList() const RELEASE(_locksLock); // with the condition that the list's size says

    LockFactory _makeLock;
    const Clock& _clock;
    std::unique_ptr<InterruptibleSleep> _sleep;
    mutable ConditionLock _locksLock{0}; // condition 1: _heldLocks is not empty (or the thread is to end)
    std::vector<Held> _heldLocks GUARDED_BY(_locksLock); // in the order they were taken
    std::atomic<bool> _ending{false};
    std::thread _renewer;
};

} // namespace rolvane
