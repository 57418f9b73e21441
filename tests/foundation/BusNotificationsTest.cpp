#include "foundation/CXException.h"
#include "foundation/LoopDelivery.h"
#include "foundation/Notification.h"
#include "foundation/RunLoop.h"
#include "support/CapturingLog.h"
#include "support/ChildProcess.h"
#include "support/PrivateBus.h"
#include "support/TempHome.h"
#include "support/WaitUntil.h"

#include <chrono>
#include <fstream>
#include <thread>

#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

struct Bus : testing::Test {
    RunLoop loop;
    PrivateBus bus;
    std::unique_ptr<DistributedNotifications> center = make();
    std::vector<Notification> heard;

    std::unique_ptr<DistributedNotifications> make() { return makeBusNotifications(loop, bus.address()); }
    [[nodiscard]] ObservationHandle listen(const std::string& name, bool coalesce = false) {
        return center->observe(
            name, [this](const Notification& n) { heard.push_back(n); }, coalesce);
    }
    testing::AssertionResult hear(size_t count) {
        return waitUntil(
            loop, [&] { return heard.size() >= count; }, std::to_string(count) + " notifications");
    }
    // Everything that was posted before is delivered: signals of one sender keep their order.
    testing::AssertionResult settle() {
        bool marked = false;
        auto marker = center->observe(
            "Marker", [&](const Notification&) { marked = true; }, false);
        center->post({"Marker", {}, {}});
        return waitUntil(
            loop, [&] { return marked; }, "the marker");
    }
    void emit(const std::vector<std::string>& arguments) {
        std::vector<std::string> command{"busctl", "--address=" + bus.address(), "emit", "/net/rolvane/Notifications",
                                         "net.rolvane.Notifications"};
        command.insert(command.end(), arguments.begin(), arguments.end());
        ChildProcess child(command);
        auto ending = child.wait();
        ASSERT_TRUE(ending && ending->exitedWith(0)) << child.errors();
    }
};

double secondsOf(const std::function<void()>& work) {
    auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

} // namespace

TEST_F(Bus, EveryKindOfValueArrivesAsItWasPosted) {
    auto listening = listen("Everything");
    Dictionary info{{"boolean", true},
                    {"integer", int64_t(-9'007'199'254'740'993)},
                    {"real", 0.25},
                    {"string", "Zoë 漢字"},
                    {"date", Date(1'700'000'000.5)},
                    {"data", Bytes{0, 1, 255}},
                    {"empty data", Bytes{}},
                    {"array", Array{"a", 1, Array{}, Dictionary{{"x", false}}}},
                    {"dictionary", Dictionary{{"nested", Dictionary{{"deep", "value"}}}}}};
    EXPECT_TRUE(center->post({"Everything", "an object", info}));
    ASSERT_TRUE(hear(1));
    EXPECT_EQ(heard[0].name, "Everything");
    EXPECT_EQ(heard[0].object, "an object");
    EXPECT_EQ(heard[0].userInfo, info) << description(heard[0].userInfo);
    EXPECT_TRUE(heard[0].userInfo["date"].isDate());
    EXPECT_EQ(heard[0].userInfo["boolean"].type(), ValueType::boolean);
}

TEST_F(Bus, ANotificationWithoutObjectAndDataArrivesWithNone) {
    auto listening = listen("Started");
    center->post({"Started", {}, {}});
    ASSERT_TRUE(hear(1));
    EXPECT_FALSE(heard[0].object);
    EXPECT_TRUE(heard[0].userInfo.empty());
}

TEST_F(Bus, TextThatIsNotUTF8ArrivesWithReplacementCharacters) {
    auto listening = listen("Text");
    center->post({"Text", {}, {{"broken", std::string("a\xff\xc3(") + '\0' + "b\xed\xa0\x80"}}});
    ASSERT_TRUE(hear(1));
    const std::string r = "\xef\xbf\xbd";
    EXPECT_EQ(heard[0].userInfo["broken"].string(), "a" + r + r + "(" + r + "b" + r + r + r);
}

TEST_F(Bus, DataNestedTooDeepForTheBusIsRefusedWithALineInTheLog) {
    CapturingLog log;
    Value deep = 1;
    for (int i = 0; i < 15; ++i) deep = Dictionary{{"deep", deep}};
    auto deepest = listen("Deepest");
    EXPECT_TRUE(center->post({"Deepest", {}, {{"deep", deep}}}));
    EXPECT_TRUE(hear(1));
    EXPECT_EQ(heard.at(0).userInfo["deep"], deep);
    EXPECT_FALSE(center->post({"Deep", {}, {{"deep", Array{deep}}}}));
    EXPECT_TRUE(log.mentions("Notification Deep cannot be sent")) << log.text();
    auto listening = listen("After");
    EXPECT_TRUE(center->post({"After", {}, {}}));
    EXPECT_TRUE(hear(2));
}

TEST_F(Bus, AnotherProcessIsHeard) {
    auto listening = listen("SimulateVaultraNotification");
    emit({"SimulateVaultraNotification", "a{sv}", "2", "object", "s", "someone", "count", "u", "7"});
    ASSERT_TRUE(hear(1));
    EXPECT_EQ(heard[0].object, "someone");
    EXPECT_EQ(heard[0].userInfo, (Dictionary{{"count", 7}})) << description(heard[0].userInfo);
}

TEST_F(Bus, ASignalWithAnotherBodyIsHeardWithWhatCanBeRead) {
    auto listening = listen("Odd");
    emit({"Odd"});
    emit({"Odd", "su", "text", "5"});
    emit({"Odd", "a{sv}", "1", "list", "aq", "2", "3", "4"});
    emit({"Odd", "a{ss}", "1", "key", "text"});
    ASSERT_TRUE(hear(4));
    EXPECT_TRUE(heard[0].userInfo.empty());
    EXPECT_TRUE(heard[1].userInfo.empty());
    EXPECT_EQ(heard[2].userInfo, (Dictionary{{"list", Array{3, 4}}}));
    EXPECT_EQ(heard[3].userInfo, (Dictionary{{"key", "text"}}));
}

TEST_F(Bus, AnIndependentProgramSeesTheSignalAsDocumented) {
    ChildProcess monitor({"busctl", "--address=" + bus.address(), "--json=short", "monitor"});
    ASSERT_TRUE(monitor.waitForLine(".", 20)) << "busctl watches: " << monitor.errors();
    center->post({"CXDSyncProgressNotification", {}, {{"progress", 0.5}, {"remoteLocation", "local"}}});
    auto line = monitor.waitForLine("CXDSyncProgressNotification", 20);
    ASSERT_TRUE(line) << monitor.output() << monitor.errors();
    for (const char* part :
         {"\"path\":\"/net/rolvane/Notifications\"", "\"interface\":\"net.rolvane.Notifications\"",
          "\"type\":\"a{sv}\"", R"("progress":{"type":"d","data":5)", R"("remoteLocation":{"type":"s","data":"local")"})
        EXPECT_NE(line->find(part), std::string::npos) << part << " in " << *line;
}

TEST_F(Bus, WhatIsLargerThanAMessageOfTheControlSocketIsNotDelivered) {
    const CapturingLog log;
    auto observation = listen("News");
    const std::string large(LoopDelivery::kMostBytes, 'x');
    center->post({"News", {}, {{"text", large}}});
    center->post({"News", large, {}});
    center->post({"News", {}, {{large, 1}}});
    Array many;
    for (size_t i = 0; i < LoopDelivery::kMostBytes / 10; ++i) many.append(true);
    center->post({"News", {}, {{"list", many}}});
    center->post({"News", {}, {{"text", std::string(LoopDelivery::kMostBytes / 2, 'x')}}});
    ASSERT_TRUE(hear(1));
    ASSERT_TRUE(settle());
    EXPECT_EQ(heard.size(), 1U);
    EXPECT_NE(log.text().find("is larger than"), std::string::npos);
}

TEST(SeenPosts, RemembersNoIdThatIsLongerThanOurs) {
    SeenPosts seen;
    EXPECT_TRUE(seen.isNew("an id"));
    EXPECT_FALSE(seen.isNew("an id"));
    const std::string large(SeenPosts::kLongest + 1, 'x');
    EXPECT_TRUE(seen.isNew(large));
    EXPECT_TRUE(seen.isNew(large)) << "it was kept";
}

// Only root can have a bus of another user's made, so there are tests of it where root runs them.
class BusOfAnotherUser : public testing::TestWithParam<int> {};

TEST_P(BusOfAnotherUser, IsNeitherSpokenToNorListenedTo) {
    TempDirectory directory;
    ASSERT_EQ(::chmod(directory.path().c_str(), 0777), 0);
    const std::string socket = directory / "bus", number = std::to_string(GetParam());
    std::ofstream(directory / "bus.conf")
        << "<busconfig><type>session</type><listen>unix:path=" << socket
        << "</listen><auth>EXTERNAL</auth><policy context=\"default\"><allow user=\"*\"/>"
           "<allow send_destination=\"*\" eavesdrop=\"true\"/><allow eavesdrop=\"true\"/><allow own=\"*\"/></policy>"
           "</busconfig>";
    ChildProcess bus({"setpriv", "--reuid=" + number, "--regid=" + number, "--clear-groups", "dbus-daemon",
                      "--config-file=" + (directory / "bus.conf"), "--nofork", "--nopidfile", "--print-address=1"});
    ASSERT_TRUE(bus.waitForLine("^unix:", 30)) << bus.errors();
    // Others of this user's programs do get in.
    ChildProcess other({"busctl", "--address=unix:path=" + socket, "list"});
    const auto ending = other.wait();
    ASSERT_TRUE(ending && ending->exitedWith(0)) << other.errors();
    RunLoop loop;
    const auto center = makeBusNotifications(loop, "unix:path=" + socket);
    EXPECT_FALSE(center->connected());
    EXPECT_FALSE(center->post({"News", {}, {}}));
}

GTEST_ALLOW_UNINSTANTIATED_PARAMETERIZED_TEST(BusOfAnotherUser);
INSTANTIATE_TEST_SUITE_P(Whose, BusOfAnotherUser,
                         testing::ValuesIn(::geteuid() == 0 ? std::vector{65534} : std::vector<int>()));

TEST_F(Bus, OnlyTheObservedNameIsHeard) {
    auto listening = listen("Wanted");
    center->post({"Unwanted", {}, {}});
    center->post({"Wanted", {}, {}});
    ASSERT_TRUE(settle());
    ASSERT_EQ(heard.size(), 1u);
    EXPECT_EQ(heard[0].name, "Wanted");
}

TEST_F(Bus, AnEndedObservationHearsNothingMoreAndAnotherOfTheNameGoesOn) {
    auto first = listen("Changed");
    int second = 0;
    auto other = center->observe(
        "Changed", [&](const Notification&) { ++second; }, false);
    first.reset();
    center->post({"Changed", {}, {}});
    ASSERT_TRUE(settle());
    EXPECT_TRUE(heard.empty());
    EXPECT_EQ(second, 1);
}

TEST_F(Bus, AnObserverMayEndItselfInItsHandler) {
    ObservationHandle once;
    int calls = 0;
    once = center->observe(
        "Changed",
        [&](const Notification&) {
            ++calls;
            once.reset();
        },
        false);
    center->post({"Changed", {}, {}});
    center->post({"Changed", {}, {}});
    ASSERT_TRUE(settle());
    EXPECT_EQ(calls, 1);
}

TEST_F(Bus, AnObserverMayEndTheWholeCentreInItsHandler) {
    bool ended = false;
    auto listening = center->observe(
        "Changed",
        [&](const Notification&) {
            center.reset();
            ended = true;
        },
        false);
    center->post({"Changed", {}, {}});
    center->post({"Changed", {}, {}});
    EXPECT_TRUE(waitUntil(
        loop, [&] { return ended; }, "the handler"));
    loop.runOnce(0);
    listening.reset();
}

TEST_F(Bus, AnExceptionOutOfAnObserverLeavesTheLoopAndTheNextOneIsCalledWhenItIsRunAgain) {
    auto bad = center->observe(
        "Changed", [](const Notification&) { throw CXException(kCXRangeException, "observer failed"); }, false);
    auto good = listen("Changed");
    center->post({"Changed", {}, {}});
    EXPECT_THROW(hear(1), CXException);
    EXPECT_TRUE(hear(1));
}

TEST_F(Bus, WhileSuspendedNothingIsDeliveredAndEqualNamesArriveOnceAfterwardsWithTheLatestData) {
    auto coalescing = listen("Changed", true);
    std::vector<int64_t> all;
    auto every = center->observe(
        "Changed", [&](const Notification& n) { all.push_back(n.userInfo["n"].integer()); }, false);
    center->setSuspended(true);
    // Posted by another connection and seen to have come in: the raw signals are on the bus before the marker.
    for (int i = 1; i <= 5; ++i) center->post({"Changed", {}, {{"n", i}}});
    auto second = make();
    bool passed = false;
    auto marker = second->observe(
        "Passed", [&](const Notification&) { passed = true; }, false);
    center->post({"Passed", {}, {}});
    ASSERT_TRUE(waitUntil(
        loop, [&] { return passed; }, "the bus to have passed everything on"));
    EXPECT_TRUE(heard.empty() && all.empty());
    center->setSuspended(false);
    ASSERT_TRUE(settle());
    ASSERT_EQ(heard.size(), 1u);
    EXPECT_EQ(heard[0].userInfo["n"], Value(5));
    EXPECT_EQ(all, (std::vector<int64_t>{1, 2, 3, 4, 5}));
}

TEST_F(Bus, WhatComesInWhileAHandlerIsBusyIsCoalesced) {
    std::vector<int64_t> seen;
    auto slow = center->observe(
        "Changed",
        [&](const Notification& n) {
            seen.push_back(n.userInfo["n"].integer());
            if (seen.size() > 1) return;
            for (int i = 1; i <= 5; ++i) center->post({"Changed", {}, {{"n", i}}});
            center->post({"Flushed", {}, {}});
            // A second connection that hears the last post knows that the bus has passed on all of them.
            ChildProcess ping({"busctl", "--address=" + bus.address(), "call", "org.freedesktop.DBus",
                               "/org/freedesktop/DBus", "org.freedesktop.DBus", "GetId"});
            EXPECT_TRUE(ping.wait()->exitedWith(0));
        },
        true);
    center->post({"Changed", {}, {{"n", 0}}});
    ASSERT_TRUE(waitUntil(
        loop, [&] { return seen.size() >= 2; }, "the first and the coalesced one"));
    ASSERT_TRUE(settle());
    EXPECT_EQ(seen, (std::vector<int64_t>{0, 5}));
}

TEST_F(Bus, TenThreadsPostAndEverythingArrivesOnceInTheOrderOfEachThread) {
    constexpr int kThreads = 10, kPosts = 200;
    auto listening = listen("Progress");
    std::atomic<int> refused{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < kPosts; ++i)
                if (!center->post({"Progress", {}, {{"thread", t}, {"n", i}}})) ++refused;
        });
    for (auto& thread : threads) thread.join();
    ASSERT_TRUE(settle());
    EXPECT_EQ(refused, 0);
    EXPECT_EQ(heard.size(), size_t(kThreads * kPosts));
    std::vector<int64_t> next(kThreads, 0);
    for (const auto& n : heard) {
        auto& expected = next[size_t(n.userInfo["thread"].integer())];
        ASSERT_EQ(n.userInfo["n"].integer(), expected++);
    }
}

TEST_F(Bus, APostIsSentWhenPostReturnsThoughNoLoopRuns) {
    RunLoop otherLoop;
    auto other = makeBusNotifications(otherLoop, bus.address());
    bool got = false;
    auto listening = other->observe(
        "Now", [&](const Notification&) { got = true; }, false);
    center->post({"Now", {}, {}});
    EXPECT_TRUE(waitUntil(
        otherLoop, [&] { return got; }, "the post, without our own loop being served"));
}

TEST_F(Bus, APostBeforeTheCentreEndsIsStillSent) {
    auto listening = listen("Farewell");
    auto second = make();
    second->post({"Farewell", {}, {}});
    second.reset();
    EXPECT_TRUE(hear(1));
}

TEST_F(Bus, WhenTheBusDiesPostsFailAtOnceAndWhenItIsBackBothDirectionsWorkAgain) {
    auto listening = listen("Changed");
    center->post({"Changed", {}, {{"n", 1}}});
    ASSERT_TRUE(hear(1));
    EXPECT_TRUE(center->connected());
    bus.kill();
    EXPECT_FALSE(center->connected());
    EXPECT_LT(secondsOf([&] {
                  for (int i = 0; i < 100; ++i) EXPECT_FALSE(center->post({"Changed", {}, {}}));
              }),
              5);
    loop.runOnce(0.01);
    bus.restart();
    EXPECT_TRUE(waitUntil(
        loop,
        [&] {
            return center->post({"Changed", {}, {{"n", 2}}});
        },
        "a post that goes out"));
    // The observer's connection is found again by itself; posts before that are lost, as on any bus.
    EXPECT_TRUE(waitUntil(
        loop,
        [&] {
            center->post({"Changed", {}, {{"n", 2}}});
            return heard.size() > 1;
        },
        "the observer to hear the new bus"));
    EXPECT_EQ(heard.back().userInfo["n"], Value(2));
}

TEST_F(Bus, ABusThatComesBackBetweenTwoPostsIsFoundByTheSecond) {
    EXPECT_TRUE(center->post({"Changed", {}, {}}));
    bus.kill();
    bus.restart();
    EXPECT_TRUE(center->post({"Changed", {}, {}}));
}

TEST_F(Bus, ABusThatHangsHoldsUpPostersForAMomentOnlyAndGetsWhatWasQueuedLater) {
    RunLoop otherLoop;
    auto other = makeBusNotifications(otherLoop, bus.address());
    size_t got = 0, accepted = 0;
    auto listening = other->observe(
        "Progress", [&](const Notification&) { ++got; }, false);
    bus.pause();
    Bytes padding(30'000);
    double took = secondsOf([&] {
        while (accepted < 100'000 && center->post({"Progress", {}, {{"padding", padding}}})) ++accepted;
        for (int i = 0; i < 1000; ++i) EXPECT_FALSE(center->post({"Progress", {}, {{"padding", padding}}}));
    });
    EXPECT_LT(took, 10) << accepted << " posts to a bus that hangs";
    EXPECT_LT(accepted, 100'000u) << "the queue is bounded";
    EXPECT_GT(accepted, 0u);
    bus.resume();
    // Nobody posts any more: serving the loop is enough to bring out what is queued.
    EXPECT_TRUE(waitUntil(
        loop,
        [&] {
            for (int turn = 0; turn < 200; ++turn) otherLoop.runOnce(0);
            return got == accepted;
        },
        "all accepted posts", 60))
        << got << " of " << accepted;
    EXPECT_TRUE(center->post({"Progress", {}, {}}));
}

TEST_F(Bus, ANewConnectionToABusThatHangsIsGivenUpSoon) {
    bus.pause();
    std::unique_ptr<DistributedNotifications> late;
    EXPECT_LT(secondsOf([&] {
                  late = make();
                  for (int i = 0; i < 100; ++i) EXPECT_FALSE(late->post({"Changed", {}, {}}));
              }),
              10);
    bus.resume();
}

TEST_F(Bus, ANameThatIsNoMemberIsRefused) {
    EXPECT_THROW(center->post({"no.member", {}, {}}), CXException);
    EXPECT_THROW((void)listen("no member"), CXException);
}

TEST_F(Bus, AnObservationMayOutliveTheCentre) {
    auto held = std::make_shared<int>();
    auto listening = center->observe(
        "Changed", [held](const Notification&) {}, false);
    center.reset();
    listening.reset();
    EXPECT_EQ(held.use_count(), 1);
}

TEST(WithoutABus, NothingIsSentAndNothingFails) {
    TempHome home;
    RunLoop loop;
    auto center = makeBusNotifications(loop);
    int heard = 0;
    auto listening = center->observe(
        "Changed", [&](const Notification&) { ++heard; }, true);
    EXPECT_FALSE(center->connected());
    EXPECT_FALSE(center->post({"Changed", {}, {}}));
    center->setSuspended(true);
    center->setSuspended(false);
    loop.runOnce(0);
    EXPECT_EQ(heard, 0);
}

TEST(WithoutABus, OneThatAppearsAtTheAddressOfTheEnvironmentIsFound) {
    TempHome home;
    RunLoop loop;
    PrivateBus bus;
    bus.kill();
    home.setVariable("DBUS_SESSION_BUS_ADDRESS", bus.address());
    auto center = makeBusNotifications(loop);
    int heard = 0;
    auto listening = center->observe(
        "Changed", [&](const Notification&) { ++heard; }, true);
    EXPECT_FALSE(center->post({"Changed", {}, {}}));
    bus.restart();
    EXPECT_TRUE(waitUntil(
        loop,
        [&] {
            center->post({"Changed", {}, {}});
            return heard > 0;
        },
        "the bus to be found"));
}

TEST(WithoutABus, TheBusOfTheRuntimeDirectoryIsUsedWhenNoAddressIsSet) {
    TempHome home;
    PrivateBus bus;
    std::string socket = bus.address().substr(bus.address().find('/'));
    home.setVariable("XDG_RUNTIME_DIR", socket.substr(0, socket.rfind('/')));
    RunLoop loop;
    EXPECT_TRUE(makeBusNotifications(loop)->connected());
}
