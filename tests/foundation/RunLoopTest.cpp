#include "foundation/RunLoop.h"

#include "foundation/CXException.h"
#include "support/WaitUntil.h"

#include <atomic>
#include <chrono>
#include <stdexcept>
#include <thread>
#include <vector>

#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <unistd.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

struct SocketPair {
    int ours = -1, theirs = -1;
    SocketPair() {
        int ends[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) == 0)
            ours = ends[0], theirs = ends[1];
    }
    ~SocketPair() {
        ::close(ours);
        closeTheirs();
    }
    void closeTheirs() {
        if (theirs >= 0) ::close(theirs);
        theirs = -1;
    }
    void send(const std::string& text) { ASSERT_EQ(::write(theirs, text.data(), text.size()), ssize_t(text.size())); }
    std::string receive() {
        char buffer[100];
        ssize_t n = ::read(ours, buffer, sizeof buffer);
        return n > 0 ? std::string(buffer, size_t(n)) : "";
    }
};

double secondsOf(const std::function<void()>& work) {
    auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

Date inSeconds(double seconds) {
    return Clock::system().now().addingSeconds(seconds);
}

} // namespace

TEST(RunLoop, ATimerFiresOnceAfterItsTime) {
    RunLoop loop;
    int fired = 0;
    auto timer = loop.scheduleTimer(0.02, [&] {
        ++fired;
        loop.stop();
    });
    EXPECT_GE(secondsOf([&] { loop.runUntil(inSeconds(10)); }), 0.02);
    loop.runOnce(0);
    EXPECT_EQ(fired, 1);
}

TEST(RunLoop, TimersFireInTheOrderOfTheirTimes) {
    RunLoop loop;
    std::string order;
    auto late = loop.scheduleTimer(0.03, [&] { order += "c", loop.stop(); });
    auto early = loop.scheduleTimer(0.01, [&] { order += "b"; });
    auto now = loop.scheduleTimer(0, [&] { order += "a"; });
    loop.runUntil(inSeconds(10));
    EXPECT_EQ(order, "abc");
}

TEST(RunLoop, ATimerWhoseHandleIsDestroyedDoesNotFire) {
    RunLoop loop;
    int fired = 0;
    auto a = loop.scheduleTimer(0.001, [&] { ++fired; });
    auto b = loop.scheduleTimer(0, [&] { ++fired; });
    a.reset();
    b.reset();
    loop.runUntil(inSeconds(0.02));
    EXPECT_EQ(fired, 0);
}

TEST(RunLoop, ATimerThatIsDueButInvalidatedByAnEarlierHandlerDoesNotFire) {
    RunLoop loop;
    std::string order;
    RunLoop::Handle second;
    auto first = loop.scheduleTimer(0, [&] {
        order += "first";
        second.reset();
    });
    second = loop.scheduleTimer(0, [&] { order += "second"; });
    loop.runOnce(0);
    loop.runOnce(0);
    EXPECT_EQ(order, "first");
}

TEST(RunLoop, ATimerMayInvalidateAndReplaceItselfInItsOwnHandler) {
    RunLoop loop;
    int fired = 0;
    RunLoop::Handle timer;
    std::function<void()> again = [&] {
        if (++fired == 3) return loop.stop();
        timer = loop.scheduleTimer(0.001, again);
    };
    timer = loop.scheduleTimer(0, again);
    loop.runUntil(inSeconds(10));
    EXPECT_EQ(fired, 3);
}

TEST(RunLoop, NegativeInfiniteAndUndefinedTimesAreTakenAsTheNearestPossible) {
    RunLoop loop;
    int fired = 0;
    auto past = loop.scheduleTimer(-5, [&] { ++fired; });
    auto undefined = loop.scheduleTimer(std::numeric_limits<double>::quiet_NaN(), [&] { ++fired; });
    auto never = loop.scheduleTimer(std::numeric_limits<double>::infinity(), [&] { fired += 100; });
    loop.runOnce(0);
    EXPECT_EQ(fired, 2);
}

TEST(RunLoop, ADelayedCallOfZeroSecondsRunsAfterTheCurrentHandlerAndNotWithinIt) {
    RunLoop loop;
    std::string order;
    loop.performAfterDelay(0, [&] {
        order += "<";
        loop.performAfterDelay(0, [&] { order += "called"; });
        loop.runOnce(0);
        order += ">";
    });
    loop.runOnce(0);
    EXPECT_EQ(order, "<>");
    loop.runOnce(0);
    EXPECT_EQ(order, "<>called");
}

TEST(RunLoop, DelayedCallsRunInTheOrderOfTheirRequests) {
    RunLoop loop;
    std::string order;
    for (char c : std::string("abcd")) loop.performAfterDelay(0, [&, c] { order += c; });
    loop.runOnce(0);
    EXPECT_EQ(order, "abcd");
}

TEST(RunLoop, ADelayedCallThatRepeatsItselfDoesNotStarveAPort) {
    RunLoop loop;
    SocketPair pair;
    std::function<void()> again = [&] { loop.performAfterDelay(0, again); };
    again();
    std::string got;
    auto port = loop.addPort(pair.ours, [&](uint32_t) { got += pair.receive(); });
    pair.send("x");
    for (int turn = 0; turn < 3; ++turn) loop.runOnce(0);
    EXPECT_EQ(got, "x");
}

TEST(RunLoop, ADelayedCallWithATimeIsMadeWithoutAnythingHoldingIt) {
    RunLoop loop;
    bool called = false;
    loop.performAfterDelay(0.005, [&] { called = true, loop.stop(); });
    loop.runUntil(inSeconds(10));
    EXPECT_TRUE(called);
}

TEST(RunLoop, RunningOnceInsideAHandlerRunsNoOtherHandlerUntilTheCurrentOneHasReturned) {
    RunLoop loop;
    SocketPair pair;
    bool inside = false, nested = false;
    int ran = 0;
    auto note = [&] { nested |= inside, ++ran; };
    auto port = loop.addPort(pair.ours, [&](uint32_t) { pair.receive(), note(); });
    auto timer = loop.scheduleTimer(0, [&] {
        inside = true;
        loop.performAfterDelay(0, note);
        pair.send("x");
        for (int i = 0; i < 3; ++i) loop.runOnce(0.001);
        inside = false;
    });
    loop.runOnce(0);
    EXPECT_EQ(ran, 0);
    loop.runOnce(0);
    EXPECT_EQ(ran, 2);
    EXPECT_FALSE(nested);
}

TEST(RunLoop, RunningUntilADateInsideAHandlerIsRefused) {
    RunLoop loop;
    bool refused = false;
    loop.performAfterDelay(0, [&] {
        try {
            loop.runUntil(inSeconds(5));
        } catch (const CXException& e) {
            refused = e.reason().find("cannot run the run loop that runs it") != std::string::npos;
        }
    });
    loop.runOnce(0);
    EXPECT_TRUE(refused);
}

TEST(RunLoop, APortReportsWhatIsThereUntilItIsRead) {
    RunLoop loop;
    SocketPair pair;
    int calls = 0;
    auto port = loop.addPort(pair.ours, [&](uint32_t events) {
        EXPECT_TRUE(events & EPOLLIN);
        if (++calls == 2) {
            EXPECT_EQ(pair.receive(), "hello");
        }
    });
    pair.send("hello");
    for (int turn = 0; turn < 4; ++turn) loop.runOnce(0);
    EXPECT_EQ(calls, 2) << "level-triggered: once more after a handler that did not read, and no more after reading";
}

TEST(RunLoop, APortThatIsClosedByItsPeerIsReportedAndMayEndItself) {
    RunLoop loop;
    SocketPair pair;
    int calls = 0;
    RunLoop::Handle port;
    port = loop.addPort(pair.ours, [&](uint32_t events) {
        EXPECT_TRUE(events & EPOLLHUP);
        ++calls;
        port.reset();
    });
    pair.closeTheirs();
    for (int turn = 0; turn < 3; ++turn) loop.runOnce(0);
    EXPECT_EQ(calls, 1);
}

TEST(RunLoop, AHangupReachesAPortThatAsksForNothing) {
    RunLoop loop;
    SocketPair pair;
    std::vector<uint32_t> events;
    auto port = loop.addPort(
        pair.ours, [&](uint32_t e) { events.push_back(e); }, 0);
    pair.send("ignored");
    loop.runOnce(0);
    EXPECT_TRUE(events.empty());
    pair.closeTheirs();
    loop.runOnce(0);
    ASSERT_EQ(events.size(), 1u);
    EXPECT_TRUE(events[0] & EPOLLHUP);
    EXPECT_FALSE(events[0] & EPOLLIN);
}

TEST(RunLoop, APortThatIsEndedWhileItIsDueIsNotCalled) {
    RunLoop loop;
    SocketPair one, two;
    int calls = 0;
    RunLoop::Handle a, b;
    auto endBoth = [&](uint32_t) {
        ++calls;
        a.reset();
        b.reset();
    };
    a = loop.addPort(one.ours, endBoth);
    b = loop.addPort(two.ours, endBoth);
    one.send("x");
    two.send("x");
    loop.runOnce(0);
    loop.runOnce(0);
    EXPECT_EQ(calls, 1);
}

TEST(RunLoop, ADescriptorThatCannotBeWatchedIsRefused) {
    RunLoop loop;
    SocketPair pair;
    EXPECT_THROW((void)loop.addPort(-1, [](uint32_t) {}), CXException);
    auto port = loop.addPort(pair.ours, [](uint32_t) {});
    EXPECT_THROW((void)loop.addPort(pair.ours, [](uint32_t) {}), CXException);
}

TEST(RunLoop, AnExceptionOutOfAHandlerReachesTheCallerAndTheRestStaysDue) {
    RunLoop loop;
    std::string order;
    loop.performAfterDelay(0, [&] { throw CXException(kCXRangeException, "out of range"); });
    loop.performAfterDelay(0, [&] { throw std::logic_error("not ours"); });
    loop.performAfterDelay(0, [&] { order += "kept"; });
    EXPECT_THROW(loop.runUntil(inSeconds(5)), CXException);
    EXPECT_THROW(loop.runUntil(inSeconds(5)), std::logic_error);
    EXPECT_EQ(order, "");
    loop.runOnce(0);
    EXPECT_EQ(order, "kept");
}

TEST(RunLoop, APortWhoseHandlerThrewGoesOnWhenTheLoopIsRunAgain) {
    RunLoop loop;
    SocketPair pair;
    int calls = 0;
    auto port = loop.addPort(pair.ours, [&](uint32_t) {
        pair.receive();
        if (++calls == 1) throw CXException(kCXRangeException, "out of range");
    });
    pair.send("x");
    EXPECT_THROW(loop.runUntil(inSeconds(5)), CXException);
    pair.send("y");
    loop.runOnce(5);
    EXPECT_EQ(calls, 2);
}

TEST(RunLoop, StoppingEndsTheRunAfterTheCurrentHandlerAndKeepsTheRestDue) {
    RunLoop loop;
    std::string order;
    loop.performAfterDelay(0, [&] {
        loop.stop();
        order += "a";
    });
    loop.performAfterDelay(0, [&] { order += "b"; });
    loop.runUntil(Date::distantFuture());
    EXPECT_EQ(order, "a");
    loop.runOnce(0);
    EXPECT_EQ(order, "ab");
}

TEST(RunLoop, AStopWithoutARunIsForgotten) {
    RunLoop loop;
    loop.stop();
    bool fired = false;
    auto timer = loop.scheduleTimer(0.002, [&] { fired = true, loop.stop(); });
    loop.runUntil(inSeconds(10));
    EXPECT_TRUE(fired);
}

TEST(RunLoop, ARunUntilThePastServesNothing) {
    RunLoop loop;
    bool ran = false;
    loop.performAfterDelay(0, [&] { ran = true; });
    loop.runUntil(inSeconds(-1));
    EXPECT_FALSE(ran);
}

TEST(RunLoop, RunningOnceWithNothingToDoWaitsForItsLimitAndNotLonger) {
    RunLoop loop;
    double took = secondsOf([&] { loop.runOnce(0.02); });
    EXPECT_GE(took, 0.019);
    EXPECT_LT(took, 5);
}

TEST(RunLoop, AnotherThreadWakesALoopThatWaits) {
    RunLoop loop;
    std::atomic<bool> ready = false;
    std::thread other([&] {
        ready = true;
        loop.wake();
    });
    EXPECT_LT(secondsOf([&] { loop.runOnce(30); }), 20);
    EXPECT_TRUE(ready);
    other.join();
}

TEST(RunLoop, WakesBeforeAWaitAreNotLostAndCountOnce) {
    RunLoop loop;
    for (int i = 0; i < 5; ++i) loop.wake();
    EXPECT_LT(secondsOf([&] { loop.runOnce(30); }), 20);
    EXPECT_GE(secondsOf([&] { loop.runOnce(0.01); }), 0.009);
}

TEST(RunLoop, EveryThreadHasALoopOfItsOwnThatLivesAsLongAsTheThread) {
    RunLoop* ours = &RunLoop::current();
    EXPECT_EQ(ours, &RunLoop::current());
    RunLoop* theirs = nullptr;
    int fired = 0;
    std::thread([&] {
        theirs = &RunLoop::current();
        auto timer = RunLoop::current().scheduleTimer(0.001, [&] { ++fired, RunLoop::current().stop(); });
        RunLoop::current().runUntil(inSeconds(10));
    }).join();
    EXPECT_NE(ours, theirs);
    EXPECT_EQ(fired, 1);
}

TEST(RunLoop, HandlesMayOutliveTheirLoopAndKeepWhatTheyHoldUntilTheyEnd) {
    auto loop = std::make_unique<RunLoop>();
    SocketPair pair;
    auto held = std::make_shared<int>(0);
    auto due = loop->scheduleTimer(0, [held] { ++*held; });
    auto later = loop->scheduleTimer(100, [held] { ++*held; });
    auto port = loop->addPort(pair.ours, [held](uint32_t) { ++*held; });
    loop->performAfterDelay(100, [held] { ++*held; });
    EXPECT_EQ(held.use_count(), 5);
    loop.reset();
    EXPECT_EQ(held.use_count(), 4) << "the delayed call went with the loop";
    due.reset();
    later.reset();
    port.reset();
    EXPECT_EQ(held.use_count(), 1);
    EXPECT_EQ(*held, 0);
}

TEST(RunLoop, WhatATimerHoldsIsReleasedWhenItHasFired) {
    RunLoop loop;
    auto held = std::make_shared<int>(1);
    std::weak_ptr<int> watch = held;
    auto timer = loop.scheduleTimer(0, [held] { (void)*held; });
    held.reset();
    EXPECT_FALSE(watch.expired());
    loop.runOnce(0);
    EXPECT_TRUE(watch.expired());
}

TEST(RunLoop, HundredsOfTimersAllFire) {
    RunLoop loop;
    int fired = 0;
    std::vector<RunLoop::Handle> timers;
    for (int i = 0; i < 900; ++i) timers.push_back(loop.scheduleTimer(1e-6, [&] { ++fired; }));
    EXPECT_TRUE(waitUntil(
        loop, [&] { return fired == 900; }, "all timers"));
}
