#pragma once

#include "store/CXDAVManager.h"
#include "store/CXWebDAVLock.h"
#include "store/Multistatus.h"

#include <memory>
#include <mutex>
#include <optional>
#include <string>

namespace rolvane {

// Remembers the lock token that a process of this user took for a URL, so that the next run can take over the lock of
// one that was killed. One file a URL below `directory`; empty: remembers nothing. A failure costs a wait, no more.
//
// A process may be killed before it hears of the token that it asked for. So a lock's owner, which everybody sees,
// carries a mark of the process that says nothing to others; which process it is stands below `directory`-runs.
class LockLedger {
public:
    explicit LockLedger(std::string directory) : _directory(std::move(directory)) {}
    void note(const std::string& url, const LockToken& token);
    void strike(const std::string& url);
    // The token of a process that has ended, or nothing.
    std::optional<LockToken> orphan(const std::string& url) const;
    // Of this process; written down before it is given out. Empty when it cannot be.
    std::string markOfThisRun() const;
    // Whether the mark is that of a process of this user that has ended.
    bool isOfAnEndedRun(const std::string& mark) const;
    static LockLedger user(); // in the user's state directory

private:
    std::string pathFor(const std::string& url) const;
    std::string pathForRun(const std::string& mark) const;
    std::string _directory;
};

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
    HttpResponse ask(const LockToken& refreshed);
    bool take(const HttpResponse& answer, const LockToken& known);
    bool takeOver();
    std::optional<LockToken> tokenOfAnEndedRun();
    void lose(bool gone);

    const std::weak_ptr<CXDAVManager::Impl> _client;
    const Url _name;
    std::optional<Url> _endpoint;
    LockLedger _ledger;
    const Clock& _clock;
    std::mutex _calls;         // one call at a time
    mutable std::mutex _mutex; // guards the following
    LockToken _token;
    double _ends = 0; // seconds since boot
};

} // namespace rolvane
