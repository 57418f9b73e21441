#pragma once

#include "foundation/Mutex.h"
#include "store/dav/CXDAVManager.h"
#include "store/dav/Multistatus.h"
#include "store/locks/CXWebDAVLock.h"
#include "store/locks/LockLedger.h"

#include <memory>
#include <optional>
#include <string>

namespace rolvane {

// A WebDAV write lock of depth 0 (RFC 4918 sections 6 and 9.10). How long it is good for is measured on a clock that
// nobody sets and that goes on while the machine sleeps; `clock` only turns that into a date.
class StoreLock : public CXWebDAVLock {
public:
    StoreLock(std::shared_ptr<CXDAVManager::Impl> client, Url name, LockLedger ledger,
              const Clock& clock = Clock::system());

    bool tryLock() override;
    void unlock() override;
    bool renew() override;
    bool locked() const override;
    Date expires() const override;
    const Url& url() const override { return _name; }

private:
    enum class Had {
        lock,
        noNeed, // the store keeps none for us
        none,
        unknown, // it may stand, and the store does not tell
    };
    HttpResponse ask(const LockToken& refreshed, const std::string& mark = {});
    Had attempt(CXDAVManager::Impl& client, const std::optional<LockToken>& orphan);
    bool take(const HttpResponse& answer, const LockToken& known);
    bool keep(const LockGrant& grant);
    bool takeOver(CXDAVManager::Impl& client, const std::optional<LockToken>& orphan);
    void lose(bool gone);

    const std::weak_ptr<CXDAVManager::Impl> _client;
    const Url _name;
    std::optional<Url> _endpoint;
    LockLedger _ledger;
    const Clock& _clock;
    Mutex _calls; // one call at a time
    mutable Mutex _mutex;
    LockToken _token GUARDED_BY(_mutex);
    double _ends GUARDED_BY(_mutex) = 0; // seconds since boot
};

} // namespace rolvane
