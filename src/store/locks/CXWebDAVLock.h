#pragma once

#include "foundation/Date.h"
#include "foundation/Url.h"

#include <functional>
#include <memory>

namespace rolvane {

// An exclusive, expiring lock on one URL: a WebDAV write lock of depth 0 (RFC 4918 section 6) for http and https URLs,
// a lock file for file URLs. Any thread may use it, one call at a time is carried out. Never throws.
// While it is held, writes of this process's client to its URL carry the token. An object that is destroyed while it
// holds its lock does not release it: `unlock` does.
class CXWebDAVLock {
public:
    virtual ~CXWebDAVLock() = default;

    // True when it is held afterwards, and when none is needed: the store lets us write nothing there, or keeps no
    // locks at all. Does not wait for another holder.
    virtual bool tryLock() = 0;
    // A lock that is not held is given back, too, where the store may have granted it unheard. What fails is left to
    // the next one that asks, or to expire.
    virtual void unlock() = 0;
    virtual bool renew() = 0;        // false: the lock is lost and no longer held
    virtual bool locked() const = 0; // taken, not released, not known to be lost
    // When the lock ends unless it is renewed. Of a lock that is not held: lockTimeout() from now, at every call, so
    // that whoever sleeps until the soonest expiry neither spins nor oversleeps a held one.
    virtual Date expires() const = 0;
    virtual const Url& url() const = 0;

    static double lockTimeout() { return 300; } // seconds asked for

    // The lock for the URL through CXDAVManager::defaultManager, not yet taken. Never null.
    static std::shared_ptr<CXWebDAVLock> initWithURL(const Url& url);
};

// Makes locks. Exists so that tests can replace them.
using LockFactory = std::function<std::shared_ptr<CXWebDAVLock>(const Url&)>;

class CXDAVManager;
// A lock on the store of this client. The client may end before the lock; operations then fail.
std::shared_ptr<CXWebDAVLock> makeStoreLock(CXDAVManager& manager, const Url& url);
// Gives back what runs of this user that have ended, killed most likely, still hold on the store, and what this client
// may have there without holding it, because an answer was lost: until such locks expire, others would wait for nobody.
// Asks the store only where such a lock is known of. While no lock of this client's is being asked for. Never throws.
void releaseLocksOfEndedRuns(CXDAVManager& manager);
std::shared_ptr<CXWebDAVLock> makeFileLock(const Url& fileUrl, Clock& clock = Clock::system());

} // namespace rolvane
