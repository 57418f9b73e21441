#include "engine/pass/RemoteLocks.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/SignOfLife.h"
#include "foundation/TestSwitch.h"

#include <algorithm>
#include <cctype>
#include <chrono>
#include <string_view>
#include <utility>

namespace rolvane {

namespace {

constexpr double kRenewBeforeExpiry = 30; // seconds
constexpr const char* kTreeFolder = "Contacts";
constexpr const char* kLockFile = "dateFile";

bool isStoreScheme(std::string_view scheme) {
    return scheme.size() == 4 && std::equal(scheme.begin(), scheme.end(), "http",
                                            [](unsigned char a, char b) { return std::tolower(a) == b; });
}

// What goes wrong on the renewal thread is a renewal that failed, and no more.
bool renews(CXWebDAVLock& lock) {
    const WithoutSignsOfLife beside; // the pass that holds the lock may be stuck
    try {
        return lock.renew();
    } catch (const CXException& e) {
        CXLog("A lock could not be renewed: %@", e);
        return false;
    }
}

class SteadySleep : public InterruptibleSleep {
public:
    bool sleep(double seconds) override {
        Lock guard(_mutex);
        const auto interrupted = [this]() REQUIRES(_mutex) { return _interrupted; };
        // A day at a time keeps the arithmetic of any expiry date within the clock's range.
        const std::chrono::duration<double> time(std::min(seconds, 86400.0));
        const bool cut = _wake.wait_for(guard, time, interrupted);
        _interrupted = false;
        return !cut && seconds <= 86400.0;
    }
    void interrupt() override {
        const Lock guard(_mutex);
        _interrupted = true;
        _wake.notify_all();
    }

private:
    Mutex _mutex;
    Condition _wake;
    bool _interrupted GUARDED_BY(_mutex) = false;
};

} // namespace

std::unique_ptr<InterruptibleSleep> makeInterruptibleSleep() {
    return std::make_unique<SteadySleep>();
}

RemoteLocks::RemoteLocks(LockFactory makeLock, const Clock& clock, std::unique_ptr<InterruptibleSleep> sleep)
    : _makeLock(std::move(makeLock)), _clock(clock), _sleep(std::move(sleep)) {}

RemoteLocks::~RemoteLocks() {
    stopRenewing();
}

std::optional<Url> RemoteLocks::lockTarget(const Url& url) {
    if (!isStoreScheme(url.scheme())) return url;
    Url folder = url;
    for (std::string last = folder.cxLastComponent(); last != kTreeFolder; last = folder.cxLastComponent()) {
        if (last.empty()) return std::nullopt;
        folder = folder.cxURLByDeletingLastComponent();
    }
    return folder.cxURLByAppendingComponent(kLockFile);
}

void RemoteLocks::unlockList() const {
    _locksLock.unlockWithCondition(_heldLocks.empty() ? 0 : 1);
}

bool RemoteLocks::lockURL(const Url& url) {
    const std::optional<Url> target = lockTarget(url);
    if (!target) return false;
    const std::string& key = target->absoluteString();

    std::promise<void> attempt;
    _locksLock.lock();
    for (const Held& held : _heldLocks) {
        if (held.key != key) continue;
        const std::shared_future<void> tried = held.tried;
        unlockList();
        tried.wait();
        return true;
    }
    std::shared_ptr<CXWebDAVLock> lock;
    try {
        lock = _makeLock(*target);
        _heldLocks.push_back({lock, key, attempt.get_future().share()});
    } catch (...) {
        unlockList();
        throw;
    }
    unlockList();

    const bool taken = lock->tryLock();
    attempt.set_value();
    _sleep->interrupt(); // only now is its expiry known
    return taken;
}

void RemoteLocks::unlockAllURLs() {
    // Latest first. The renewal thread may take locks out meanwhile, so the list is looked at anew for each.
    for (;;) {
        _locksLock.lock();
        if (_heldLocks.empty()) {
            unlockList();
            break;
        }
        const Held last = std::move(_heldLocks.back());
        _heldLocks.pop_back();
        unlockList();
        try {
            if (!isLeftOut("unlocking")) last.lock->unlock();
        } catch (const CXException& e) {
            CXLog("The lock on %s is left to expire: %@", last.key, e);
        }
    }
    _sleep->interrupt();
}

size_t RemoteLocks::count() const {
    _locksLock.lock();
    const size_t held = _heldLocks.size();
    _locksLock.unlock();
    return held;
}

int RemoteLocks::condition() const {
    return _locksLock.condition();
}

void RemoteLocks::startRenewing() {
    if (!_renewer.joinable()) _renewer = std::thread([this] { renewLocks(); });
}

void RemoteLocks::stopRenewing() {
    if (!_renewer.joinable()) return;
    _ending = true;
    _locksLock.lock();
    _locksLock.unlockWithCondition(1); // lets the thread out of its wait
    _sleep->interrupt();
    _renewer.join();
    _locksLock.lock();
    unlockList();
}

void RemoteLocks::renewLocks() {
    std::shared_ptr<CXWebDAVLock> renewedLast;
    while (!_ending) renewOnce(renewedLast);
}

void RemoteLocks::renewOnce(std::shared_ptr<CXWebDAVLock>& renewedLast) {
    _locksLock.lockWhenCondition(1);
    if (_ending || _heldLocks.empty()) {
        unlockList();
        return;
    }
    std::shared_ptr<CXWebDAVLock> chosen;
    double seconds = 0; // until the chosen lock expires
    for (const Held& held : _heldLocks) {
        const double left = held.lock->expires().secondsSince(_clock.now());
        if (chosen && left >= seconds) continue;
        chosen = held.lock;
        seconds = left;
    }
    unlockList();

    double pause = std::max(0.0, seconds - kRenewBeforeExpiry);
    // A store that grants less than the margin would otherwise be asked without a pause.
    if (pause <= 0 && chosen == renewedLast) pause = std::max(1.0, seconds / 2);
    renewedLast.reset();
    if (!_sleep->sleep(pause) || _ending) return; // the list changed, or the end: choose again
    if (!chosen->locked()) return;
    if (renews(*chosen)) {
        renewedLast = chosen;
        return;
    }
    _locksLock.lock();
    std::erase_if(_heldLocks, [&](const Held& held) { return held.lock == chosen; });
    unlockList();
}

} // namespace rolvane
