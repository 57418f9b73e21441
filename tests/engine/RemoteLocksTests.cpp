#include "engine/pass/RemoteLocks.h"

#include "Records.h"
#include "foundation/CXException.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <map>

namespace rolvane {
namespace {

// A store that grants or refuses locks and writes down what it was asked.
class FakeStore {
public:
    explicit FakeStore(const Clock& clock) : _clock(clock) {}
    bool grants = true, renews = true;
    std::string breaksAt; // "renew" or "unlock": that request ends in an exception
    double timeout = 300;
    std::function<void()> beforeTry; // on the thread that takes the lock

    LockFactory factory() {
        return [this](const Url& url) -> std::shared_ptr<CXWebDAVLock> { return std::make_shared<Lock>(*this, url); };
    }
    std::vector<std::string> asked() const {
        const std::lock_guard guard(_mutex);
        return _asked;
    }
    void waitFor(const std::string& request, size_t times) {
        std::unique_lock guard(_mutex);
        _changed.wait(guard,
                      [&] { return static_cast<size_t>(std::count(_asked.begin(), _asked.end(), request)) >= times; });
    }

private:
    class Lock : public CXWebDAVLock {
    public:
        Lock(FakeStore& store, Url url) : _store(store), _url(std::move(url)) {}
        bool tryLock() override {
            if (_store.beforeTry) _store.beforeTry();
            return ask("lock", _store.grants);
        }
        void unlock() override { ask("unlock", false); }
        bool renew() override { return ask("renew", _store.renews); }
        bool locked() const override {
            const std::lock_guard guard(_store._mutex);
            return _locked;
        }
        Date expires() const override {
            const std::lock_guard guard(_store._mutex);
            return _locked ? _expires : _store._clock.now().addingSeconds(300);
        }
        const Url& url() const override { return _url; }

    private:
        bool ask(const char* what, bool held) {
            const std::lock_guard guard(_store._mutex);
            _locked = held;
            _expires = _store._clock.now().addingSeconds(_store.timeout);
            _store._asked.push_back(std::string(what) + " " + _url.absoluteString());
            _store._changed.notify_all();
            if (_store.breaksAt == what) throw CXException("TestException", "no answer");
            return held;
        }
        FakeStore& _store;
        Url _url;
        bool _locked = false;
        Date _expires;
    };
    const Clock& _clock;
    mutable std::mutex _mutex;
    std::condition_variable _changed;
    std::vector<std::string> _asked;
};

// Sleeps until the test says that the time is over.
class ManualSleep : public InterruptibleSleep {
public:
    bool sleep(double seconds) override {
        std::unique_lock guard(_mutex);
        _slept.push_back(seconds);
        _changed.notify_all();
        _changed.wait(guard, [&] { return _interrupted || _over > 0 || seconds <= 0; });
        const bool over = !_interrupted;
        if (over && seconds > 0) --_over;
        _interrupted = false;
        return over;
    }
    void interrupt() override {
        const std::lock_guard guard(_mutex);
        _interrupted = true;
        _changed.notify_all();
    }
    void waitForSleepOf(double seconds) {
        std::unique_lock guard(_mutex);
        _changed.wait(guard, [&] { return !_slept.empty() && _slept.back() == seconds; });
    }
    void letTimePass() {
        const std::lock_guard guard(_mutex);
        ++_over;
        _changed.notify_all();
    }
    bool everSlept() const {
        const std::lock_guard guard(_mutex);
        return !_slept.empty();
    }

private:
    mutable std::mutex _mutex;
    std::condition_variable _changed;
    std::vector<double> _slept;
    bool _interrupted = false;
    int _over = 0;
};

class Locks : public ::testing::Test {
protected:
    ManualClock clock{Date(1000000)};
    FakeStore store{clock};
    ManualSleep* sleep = new ManualSleep; // owned by `locks`
    RemoteLocks locks{store.factory(), clock, std::unique_ptr<InterruptibleSleep>(sleep)};
    const std::string tree = "http://store.example/ann/Contacts";
    const std::string clockFile = tree + "/dateFile";
    bool lock(const std::string& below) { return locks.lockURL(Url(tree + below)); }
};

TEST_F(Locks, EverythingInsideATreeIsLockedThroughItsClockFile) {
    for (const char* below : {"", "/", "/People/3/P1", "/G1/info", "/dateFile"})
        EXPECT_EQ(RemoteLocks::lockTarget(Url(tree + below))->absoluteString(), clockFile) << below;
    EXPECT_EQ(RemoteLocks::lockTarget(Url("HTTP://store.example/ann/Contacts/G1"))->absoluteString(),
              "HTTP://store.example/ann/Contacts/dateFile");
}

TEST_F(Locks, AFileURLIsLockedItself) {
    EXPECT_EQ(RemoteLocks::lockTarget(Url("file:///usr/share/rolvane/ann/G1"))->absoluteString(),
              "file:///usr/share/rolvane/ann/G1");
}

TEST_F(Locks, AStoreURLOutsideOfAnyTreeIsNotLocked) {
    EXPECT_FALSE(RemoteLocks::lockTarget(Url("http://store.example/ann/elsewhere")));
    EXPECT_FALSE(locks.lockURL(Url("http://store.example/ann")));
    EXPECT_TRUE(store.asked().empty());
}

TEST_F(Locks, TwoRecordsOfOneTreeLockItOnce) {
    EXPECT_TRUE(lock("/People/3/P1"));
    EXPECT_TRUE(lock("/People/4/P2"));
    EXPECT_EQ(store.asked(), std::vector<std::string>{"lock " + clockFile});
    EXPECT_EQ(locks.condition(), 1);
}

TEST_F(Locks, ARefusedLockMakesOnlyTheFirstRecordWait) {
    store.grants = false;
    EXPECT_FALSE(lock("/People/3/P1"));
    EXPECT_TRUE(lock("/People/4/P2"));
    EXPECT_EQ(locks.count(), 1u);
    locks.unlockAllURLs();
    EXPECT_EQ(store.asked(), (std::vector<std::string>{"lock " + clockFile, "unlock " + clockFile}));
}

TEST_F(Locks, ReleasingNothingDoesNotWait) {
    locks.unlockAllURLs();
    EXPECT_TRUE(store.asked().empty());
    EXPECT_EQ(locks.condition(), 0);
}

TEST_F(Locks, AreReleasedLatestFirstAndTheConditionIsZeroAfterwards) {
    lock("/G1");
    locks.lockURL(Url("http://store.example/bob/Contacts/G1"));
    locks.unlockAllURLs();
    EXPECT_EQ(store.asked()[2], "unlock http://store.example/bob/Contacts/dateFile");
    EXPECT_EQ(store.asked()[3], "unlock " + clockFile);
    EXPECT_EQ(locks.condition(), 0);
    EXPECT_EQ(locks.count(), 0u);
}

TEST_F(Locks, WhoAsksWhileTheLockIsBeingTakenWaitsForThatAttempt) {
    std::promise<void> started, go;
    store.beforeTry = [&] {
        started.set_value();
        go.get_future().wait();
    };
    std::thread first([&] { EXPECT_TRUE(lock("/G1")); });
    started.get_future().wait();
    std::atomic<bool> answered{false};
    std::thread second([&] {
        EXPECT_TRUE(lock("/G2"));
        answered = true;
    });
    EXPECT_FALSE(answered) << "nothing is written before the lock has been taken";
    go.set_value();
    first.join();
    second.join();
    EXPECT_EQ(store.asked().size(), 1u);
}

TEST_F(Locks, ALockThatExpiresIn300SecondsIsRenewedAfter270) {
    locks.startRenewing();
    lock("/G1");
    sleep->waitForSleepOf(270);
    EXPECT_EQ(store.asked().size(), 1u);
    sleep->letTimePass();
    store.waitFor("renew " + clockFile, 1);
}

TEST_F(Locks, ALockThatExpiresInTenSecondsIsRenewedAtOnce) {
    store.timeout = 10;
    locks.startRenewing();
    lock("/G1");
    store.waitFor("renew " + clockFile, 1);
}

TEST_F(Locks, AStoreThatGrantsTooLittleIsNotAskedWithoutAPause) {
    store.timeout = 10;
    locks.startRenewing();
    lock("/G1");
    store.waitFor("renew " + clockFile, 1);
    sleep->waitForSleepOf(5);
}

TEST_F(Locks, TheLockThatExpiresSoonestIsRenewedFirst) {
    lock("/G1");
    store.timeout = 100;
    locks.lockURL(Url("http://store.example/bob/Contacts/G1"));
    locks.startRenewing();
    sleep->waitForSleepOf(70);
    sleep->letTimePass();
    store.waitFor("renew http://store.example/bob/Contacts/dateFile", 1);
}

TEST_F(Locks, OfTwoThatExpireTogetherTheFirstOneTakenIsRenewedFirst) {
    lock("/G1");
    locks.lockURL(Url("http://store.example/bob/Contacts/G1"));
    locks.startRenewing();
    sleep->waitForSleepOf(270);
    sleep->letTimePass();
    store.waitFor("renew " + clockFile, 1);
    EXPECT_EQ(store.asked().at(2), "renew " + clockFile);
}

TEST_F(Locks, ALockThatCannotBeRenewedIsDroppedWithoutBeingReleased) {
    store.renews = false;
    locks.startRenewing();
    lock("/G1");
    sleep->waitForSleepOf(270);
    sleep->letTimePass();
    store.waitFor("renew " + clockFile, 1);
    locks.stopRenewing();
    EXPECT_EQ(locks.count(), 0u);
    EXPECT_EQ(locks.condition(), 0);
    locks.unlockAllURLs();
    EXPECT_EQ(store.asked().size(), 2u);
}

TEST_F(Locks, AnExceptionOutOfARenewalIsAFailedRenewal) {
    const test::LogCapture log(0);
    store.breaksAt = "renew";
    locks.startRenewing();
    lock("/G1");
    sleep->waitForSleepOf(270);
    sleep->letTimePass();
    store.waitFor("renew " + clockFile, 1);
    locks.stopRenewing();
    EXPECT_EQ(locks.count(), 0u);
    EXPECT_TRUE(log.has("no answer"));
}

TEST_F(Locks, ALockThatCannotBeReleasedKeepsNoOther) {
    const test::LogCapture log(0);
    store.breaksAt = "unlock";
    lock("/G1");
    locks.lockURL(Url("http://store.example/bob/Contacts/G1"));
    locks.unlockAllURLs();
    EXPECT_EQ(store.asked().size(), 4u) << "both were asked to be released";
    EXPECT_EQ(locks.count(), 0u);
    EXPECT_TRUE(log.has("The lock on " + clockFile + " is left to expire: "));
}

TEST_F(Locks, AfterAllAreReleasedNothingIsRenewedUntilTheNextLock) {
    locks.startRenewing();
    lock("/G1");
    sleep->waitForSleepOf(270);
    locks.unlockAllURLs();
    store.timeout = 330;
    lock("/G1");
    sleep->waitForSleepOf(300);
    EXPECT_EQ(store.asked(),
              (std::vector<std::string>{"lock " + clockFile, "unlock " + clockFile, "lock " + clockFile}));
}

TEST_F(Locks, RenewingNeverSleepsWhileNoLockIsHeldAndStops) {
    locks.startRenewing();
    locks.stopRenewing();
    EXPECT_FALSE(sleep->everSlept());
}

TEST(InterruptibleSleepTest, AnInterruptionThatCameBeforeCountsOnce) {
    const auto sleep = makeInterruptibleSleep();
    sleep->interrupt();
    EXPECT_FALSE(sleep->sleep(3600));
    EXPECT_TRUE(sleep->sleep(0));
}

} // namespace
} // namespace rolvane
