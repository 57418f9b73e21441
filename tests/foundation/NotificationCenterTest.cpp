#include "foundation/CXException.h"
#include "foundation/Notification.h"

#include <atomic>
#include <thread>

#include <gtest/gtest.h>

using namespace rolvane;

TEST(NotificationCenter, ObserversAreCalledInOrderOfRegistrationBeforePostReturns) {
    NotificationCenter center;
    std::string order;
    auto a = center.observe("Changed", [&](const Notification&) { order += "a"; });
    auto b = center.observe("Changed", [&](const Notification&) { order += "b"; });
    auto other = center.observe("Other", [&](const Notification&) { order += "x"; });
    center.post({"Changed", {}, {}});
    EXPECT_EQ(order, "ab");
}

TEST(NotificationCenter, AnObserverSeesTheObjectAndTheUserDataOfThePost) {
    NotificationCenter center;
    Notification seen;
    auto a = center.observe("Changed", [&](const Notification& n) { seen = n; });
    Dictionary info{{"inserted", Array{"p1", "p2"}}};
    center.post({"Changed", "sender", info});
    EXPECT_EQ(seen.object, "sender");
    EXPECT_TRUE(seen.userInfo.isSame(info));
}

TEST(NotificationCenter, AnEndedRegistrationHearsNothing) {
    NotificationCenter center;
    int heard = 0;
    auto a = center.observe("Changed", [&](const Notification&) { ++heard; });
    a.reset();
    center.post({"Changed", {}, {}});
    EXPECT_EQ(heard, 0);
}

TEST(NotificationCenter, AnObserverMayEndItselfAndLaterOnesDuringAPost) {
    NotificationCenter center;
    std::string order;
    ObservationHandle a, b, c;
    a = center.observe("Changed", [&](const Notification&) {
        order += "a";
        a.reset();
        b.reset();
    });
    b = center.observe("Changed", [&](const Notification&) { order += "b"; });
    c = center.observe("Changed", [&](const Notification&) { order += "c"; });
    center.post({"Changed", {}, {}});
    center.post({"Changed", {}, {}});
    EXPECT_EQ(order, "acc");
}

TEST(NotificationCenter, AnObserverThatRegistersDuringAPostHearsFromTheNextOneOn) {
    NotificationCenter center;
    int heard = 0;
    ObservationHandle late;
    auto a = center.observe("Changed", [&](const Notification&) {
        if (!late) late = center.observe("Changed", [&](const Notification&) { ++heard; });
    });
    center.post({"Changed", {}, {}});
    EXPECT_EQ(heard, 0);
    center.post({"Changed", {}, {}});
    EXPECT_EQ(heard, 1);
}

TEST(NotificationCenter, WhatAHandlerThrowsReachesThePoster) {
    NotificationCenter center;
    auto a = center.observe("Changed", [](const Notification&) { throw CXException(kCXRangeException, "broken"); });
    EXPECT_THROW(center.post({"Changed", {}, {}}), CXException);
}

TEST(NotificationCenter, ARegistrationMayOutliveItsCentre) {
    auto center = std::make_unique<NotificationCenter>();
    auto held = std::make_shared<int>();
    auto a = center->observe("Changed", [held](const Notification&) {});
    center.reset();
    a.reset();
    EXPECT_EQ(held.use_count(), 1);
}

TEST(NotificationCenter, TenThreadsPostAndRegisterAtTheSameTime) {
    NotificationCenter center;
    std::atomic<int> heard{0};
    auto steady = center.observe("Changed", [&](const Notification&) { ++heard; });
    std::vector<std::thread> threads;
    for (int t = 0; t < 10; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 100; ++i) {
                auto passing = center.observe("Changed", [](const Notification&) {});
                center.post({"Changed", {}, {}});
            }
        });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(heard, 1000);
}

TEST(NotificationCenter, TheDefaultCentreIsOneForTheProcess) {
    int heard = 0;
    auto a = NotificationCenter::defaultCenter().observe("Changed", [&](const Notification&) { ++heard; });
    NotificationCenter::defaultCenter().post({"Changed", {}, {}});
    EXPECT_EQ(heard, 1);
}

// In memory.

TEST(LocalNotifications, PostsAreRecordedAndDeliveredAtOnce) {
    LocalNotifications center;
    std::string order;
    auto a = center.observe(
        "Started", [&](const Notification&) { order += "s"; }, false);
    EXPECT_TRUE(center.post({"Started", {}, {}}));
    EXPECT_EQ(order, "s");
    center.post({"Stopped", "object", {{"key", 1}}});
    auto posted = center.posted();
    ASSERT_EQ(posted.size(), 2u);
    EXPECT_EQ(posted[1].name, "Stopped");
    EXPECT_EQ(posted[1].object, "object");
    EXPECT_EQ(posted[1].userInfo, (Dictionary{{"key", 1}}));
    EXPECT_FALSE(center.connected());
    center.clear();
    EXPECT_TRUE(center.posted().empty());
}

TEST(LocalNotifications, WhatThePosterDoesWithItsDictionaryLaterChangesNothing) {
    LocalNotifications center;
    Dictionary info{{"progress", 0.5}};
    center.post({"Progress", {}, info});
    info.set("progress", 1.0);
    EXPECT_EQ(center.posted()[0].userInfo["progress"], Value(0.5));
}

TEST(LocalNotifications, WhileSuspendedEqualNamesAreCoalescedIntoOneWithTheLatestData) {
    LocalNotifications center;
    std::vector<int64_t> coalesced, all;
    auto a = center.observe(
        "Changed", [&](const Notification& n) { coalesced.push_back(n.userInfo["n"].integer()); }, true);
    auto b = center.observe(
        "Changed", [&](const Notification& n) { all.push_back(n.userInfo["n"].integer()); }, false);
    center.setSuspended(true);
    for (int i = 1; i <= 3; ++i) center.post({"Changed", {}, {{"n", i}}});
    EXPECT_TRUE(coalesced.empty() && all.empty());
    center.setSuspended(false);
    EXPECT_EQ(coalesced, (std::vector<int64_t>{3}));
    EXPECT_EQ(all, (std::vector<int64_t>{1, 2, 3}));
}

TEST(LocalNotifications, ANameThatNoBusCouldCarryIsRefused) {
    LocalNotifications center;
    for (const char* name : {"", "1st", "with space", "dotted.name", "umlautä"}) {
        EXPECT_THROW(center.post({name, {}, {}}), CXException) << name;
        EXPECT_THROW((void)center.observe(
                         name, [](const Notification&) {}, true),
                     CXException)
            << name;
    }
    EXPECT_THROW(center.post({std::string(256, 'a'), {}, {}}), CXException);
    EXPECT_TRUE(center.post({std::string(255, 'a'), {}, {}}));
    EXPECT_TRUE(center.post({"_x9", {}, {}}));
}
