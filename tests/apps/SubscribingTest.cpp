#include "Neighbour.h"

#include <filesystem>
#include <functional>
#include <map>
#include <regex>

namespace rolvane::test {
namespace {

// Alice publishes two people and a group; bob has an account on her store.
class Subscribing : public testing::Test {
protected:
    Subscribing() {
        world.bus();
        world.makeAccount();
        ada = world.add("Ada", {"--last", "Miller", "--phone", "home:+1 555 0100"});
        world.add("Bea");
        family = world.group("Family", {"Ada"});
        world.done({"publish"});
        location = world.json({"status"})["store"]["location"];
    }
    std::set<std::string> names(const nlohmann::json& records) {
        std::set<std::string> all;
        for (const auto& record : records) all.insert(record["name"]);
        return all;
    }
    // Every file of alice's tree with its contents, but for the clock file.
    std::map<std::string, std::string> contents() {
        std::map<std::string, std::string> all;
        for (const std::string& path : world.tree())
            if (path != "dateFile") all[path] = contentsOf(world.published(path));
        return all;
    }
    testing::AssertionResult nothingIsNoted() {
        const auto noted = bob.json({"subscriptions"});
        return noted.empty() ? testing::AssertionSuccess() : testing::AssertionFailure() << noted;
    }
    // Passes of hers until it holds.
    testing::AssertionResult comesToAlice(const std::function<bool()>& test) {
        for (int i = 0; i < 30; ++i) {
            if (test()) return testing::AssertionSuccess();
            world.done({"sync"});
        }
        return testing::AssertionFailure() << "not in 30 passes";
    }
    CommandWorld world;
    std::string ada, family, location;
    Neighbour bob{world, "bob"};
};

TEST_F(Subscribing, SubscribeReturnsWhenThePeopleAreHere) {
    world.done({"share", "bob"});
    const auto made = bob.json({"subscribe", "alice"});
    EXPECT_EQ(made["user"], "alice");
    EXPECT_EQ(made["location"], location);
    EXPECT_EQ(made["people"], 2);
    EXPECT_EQ(made["groups"], 1);
    EXPECT_EQ(made["writable"], false);
    EXPECT_EQ(made["pending"], 0) << "nothing of it goes back to the publisher's store";
    EXPECT_EQ(bob.json({"subscriptions"})[0]["location"], location);
    EXPECT_FALSE(bob.json({"subscriptions"})[0]["lastSeen"].is_null());
    EXPECT_EQ(names(bob.json({"list", "--of", "alice"})), (std::set<std::string>{"Ada Miller", "Bea"}));
    EXPECT_EQ(bob.json({"list", "--own"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"list"})[0]["owner"], "alice");
    const auto groups = bob.json({"group", "list", "--of", "ALICE"});
    ASSERT_EQ(groups.size(), 1U);
    EXPECT_EQ(groups[0]["owner"], "alice");
    EXPECT_EQ(groups[0]["members"].size(), 1U);
    EXPECT_NE(bob.done({"show", "Ada Miller"}).find("alice, at " + location + " (read only)"), std::string::npos);
    EXPECT_NE(bob.done({"list", "--full"}).find("Bea  [alice]"), std::string::npos);
    EXPECT_TRUE(std::regex_search(bob.done({"list"}), std::regex("Bea +\\[alice\\]\n")));
    const auto status = bob.json({"status"});
    EXPECT_EQ(status["pending"], 0);
    ASSERT_EQ(status["subscriptions"].size(), 1U);
    EXPECT_EQ(status["subscriptions"][0]["user"], "alice");
    EXPECT_NE(bob.done({"status"}).find("to alice"), std::string::npos);
    EXPECT_TRUE(saysOnce(bob.rolvane({"list", "--of", "carol"}), kNoSuchThing, "no subscription to \"carol\""));
}

TEST_F(Subscribing, AnEditOfThePublishersArrivesWithTheNextPass) {
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    world.done({"edit", "Bea", "--nickname", "Busy"});
    world.done({"sync"});
    bob.done({"sync"});
    EXPECT_EQ(bob.json({"show", "Bea"})["properties"]["Nickname"], "Busy");
}

TEST_F(Subscribing, ALocationServesAsWellAsAName) {
    world.done({"share", "bob"});
    bob.done({"subscribe", location + "/"});
    EXPECT_EQ(bob.json({"subscriptions"})[0]["user"], "alice");
    EXPECT_EQ(bob.json({"list"}).size(), 2U);
    bob.done({"unsubscribe", location});
    EXPECT_TRUE(nothingIsNoted());
}

TEST_F(Subscribing, WhatNoStoreServesIsRefused) {
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "https" + location.substr(4)}), kWrongLine, "no location"));
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "file:/usr/share/rolvane/alice"}), kWrongLine, "no location"));
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "http://elsewhere.example/alice/Contacts"}), kNoSuchThing,
                         "not on the store of your account"));
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", ""}), kWrongLine, "Name the user"));
    EXPECT_TRUE(nothingIsNoted());
}

TEST_F(Subscribing, WhoMayNotReadIsToldToAskForIt) {
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "alice"}), kNotAllowed, "`rolvane share bob`"));
    EXPECT_TRUE(nothingIsNoted());
    EXPECT_FALSE(bob.daemon());
}

TEST_F(Subscribing, OfWhatIsNotPublishedItSaysSo) {
    world.done({"share", "bob"});
    world.done({"daemon", "stop"}); // it would mend the tree
    ASSERT_TRUE(std::filesystem::remove(world.published("info")));
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "alice"}), kNoSuchThing, "has published nothing"));
    EXPECT_TRUE(nothingIsNoted());
}

TEST_F(Subscribing, WhileTheStoreIsAwayNothingIsNoted) {
    world.store().stop(PrivateStore::Stop::atOnce);
    const Ran patient = bob.rolvane({"subscribe", "alice"});
    EXPECT_EQ(patient.status, kNotReached) << patient;
    EXPECT_NE(patient.errors.find("It is asked again in"), std::string::npos) << "it may be starting\n" << patient;
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "alice", "--quiet"}), kNotReached, "Nothing was subscribed to"));
    EXPECT_TRUE(nothingIsNoted());
}

TEST_F(Subscribing, TheOwnAccountCannotBeSubscribedToInAnyLetterCase) {
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "bob"}), kNotAllowed, "your own account"));
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "BoB"}), kNotAllowed, "your own account"));
}

TEST_F(Subscribing, TwiceIsRefusedAndTheFirstOneStays) {
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    EXPECT_TRUE(saysOnce(bob.rolvane({"subscribe", "alice"}), kNotAllowed, "already"));
    EXPECT_EQ(bob.json({"list", "--of", "alice"}).size(), 2U);
}

TEST_F(Subscribing, NoDaemonOnlyNotesItAndAPassBringsThePeople) {
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice", "--no-daemon"});
    EXPECT_FALSE(bob.daemon());
    EXPECT_TRUE(bob.json({"subscriptions"})[0]["lastSeen"].is_null());
    bob.done({"sync"});
    EXPECT_EQ(bob.json({"list", "--of", "alice"}).size(), 2U);
}

TEST_F(Subscribing, ADaemonThatServesAlreadyGoesOn) {
    world.done({"share", "bob"});
    bob.done({"add", "--first", "Bob's"});
    bob.done({"publish"});
    const auto before = bob.daemon();
    ASSERT_TRUE(before);
    bob.done({"subscribe", "alice"});
    EXPECT_EQ(bob.daemon(), before);
    EXPECT_EQ(bob.json({"list"}).size(), 3U);
}

TEST_F(Subscribing, ACopyThatMayOnlyBeReadIsNotEditedDeletedOrRegrouped) {
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    bob.done({"add", "--first", "Own"});
    const auto before = bob.json({"list", "--full"});
    const auto groups = bob.json({"group", "list"});
    const std::vector<std::vector<std::string>> refused{{"edit", "Bea", "--note", "mine"},
                                                        {"delete", "Bea", "--yes"},
                                                        {"group", "rename", "Family", "Mine"},
                                                        {"group", "delete", "Family", "--yes"},
                                                        {"group", "add", "Family", "Own"},
                                                        {"group", "remove", "Family", "Ada Miller"},
                                                        {"add", "--first", "Another", "--group", "Family"}};
    for (const auto& command : refused)
        EXPECT_TRUE(saysOnce(bob.rolvane(command), kNotAllowed, "Ask alice for `rolvane share bob --write`."))
            << command[0];
    EXPECT_EQ(bob.json({"list", "--full"}), before);
    EXPECT_EQ(bob.json({"group", "list"}), groups);
}

TEST_F(Subscribing, UnsubscribingTakesTheCopiesAwayAndNothingFromThePublisher) {
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    ASSERT_EQ(bob.json({"subscriptions"})[0]["writable"], true);
    const auto before = contents();
    ASSERT_EQ(before.size(), 6U);
    const auto ended = bob.json({"unsubscribe", "alice"});
    EXPECT_EQ(ended["people"], 2);
    EXPECT_TRUE(nothingIsNoted());
    EXPECT_EQ(bob.json({"list"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"group", "list"}), nlohmann::json::array());
    // Whatever the daemon makes of it, it has made by the end of a further pass.
    bob.done({"add", "--first", "Own"});
    bob.done({"publish"});
    bob.done({"sync"});
    EXPECT_EQ(contents(), before);
    world.done({"sync"});
    EXPECT_EQ(world.json({"list"}).size(), 2U);
}

TEST_F(Subscribing, UnsubscribingWithoutADaemonCarriesNothingWhenOneStarts) {
    world.done({"share", "bob", "--write"});
    bob.done({"add", "--first", "Own"});
    bob.done({"publish"});
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"});
    const auto before = contents();
    bob.done({"unsubscribe", "alice"});
    EXPECT_FALSE(bob.daemon());
    bob.done({"daemon", "start"});
    bob.done({"sync"});
    EXPECT_EQ(contents(), before);
}

TEST_F(Subscribing, ChangesThatWereNotSentAreDroppedWithTheSubscriptionAndToldSo) {
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    const auto before = contents();
    world.store().stop(PrivateStore::Stop::atOnce);
    bob.done({"daemon", "stop"});
    bob.done({"edit", "Bea", "--note", "never sent"});
    EXPECT_EQ(bob.rolvane({"sync"}).status, kNotReached);
    ASSERT_GT(bob.json({"subscriptions"})[0]["pending"].get<int>(), 0);
    const Ran ended = bob.rolvane({"unsubscribe", "alice", "--yes"});
    EXPECT_EQ(ended.status, kDone) << ended;
    EXPECT_NE(ended.errors.find("had not been sent yet"), std::string::npos) << ended;
    EXPECT_EQ(bob.json({"status"})["pending"], 0);
    world.store().start();
    bob.done({"sync"});
    EXPECT_EQ(contents(), before);
}

TEST_F(Subscribing, OfWhomOneIsNotSubscribedToOneCannotUnsubscribe) {
    EXPECT_TRUE(saysOnce(bob.rolvane({"unsubscribe", "alice"}), kNoSuchThing, "rolvane subscriptions"));
}

TEST_F(Subscribing, WhatIsWithdrawnLeavesIsKeptAndCanBeTakenBack) {
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    world.done({"unshare", "bob"});
    const Ran sync = bob.rolvane({"sync"});
    EXPECT_EQ(sync.status, kNotAllowed) << sync;
    EXPECT_NE(sync.errors.find("alice no longer shares with you"), std::string::npos) << sync;
    EXPECT_TRUE(nothingIsNoted());
    EXPECT_EQ(bob.json({"list"}), nlohmann::json::array());
    const auto kept = bob.json({"status"})["withdrawn"];
    ASSERT_EQ(kept.size(), 1U);
    EXPECT_EQ(kept[0]["user"], "alice");
    EXPECT_EQ(kept[0]["people"], 2);
    EXPECT_EQ(kept[0]["groups"], 1);
    EXPECT_EQ(bob.json({"withdrawn", "list"}), kept);
    EXPECT_NE(bob.done({"status"}).find("alice's, 2 people and 1 group, on "), std::string::npos);
    const auto report = bob.json({"withdrawn", "import", "alice"});
    EXPECT_EQ(report["imported"], 2);
    EXPECT_EQ(report["bad"], 0);
    const auto own = bob.json({"list", "--full", "--own"});
    EXPECT_EQ(names(own), (std::set<std::string>{"Ada Miller", "Bea"}));
    EXPECT_TRUE(own[0]["location"].is_null());
    EXPECT_EQ(names(bob.json({"group", "list", "--own"})), std::set<std::string>{"Family"});
    bob.done({"edit", "Bea", "--note", "mine now"});
    bob.done({"withdrawn", "forget", kept[0]["name"], "--yes"});
    EXPECT_EQ(bob.json({"withdrawn", "list"}), nlohmann::json::array());
    EXPECT_FALSE(std::filesystem::exists(kept[0]["file"].get<std::string>()));
    EXPECT_TRUE(saysOnce(bob.rolvane({"withdrawn", "import", "alice"}), kNoSuchThing, "Nothing is kept"));
}

TEST_F(Subscribing, AWritersEditReachesThePublisher) {
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    bob.done({"edit", "Bea", "--nickname", "From bob"});
    bob.done({"sync"});
    EXPECT_TRUE(comesToAlice([&] {
        const auto bea = world.json({"show", "Bea"});
        return bea["properties"].value("Nickname", "") == "From bob";
    }));
}

TEST(SubscribingWithoutABus, WorksAllTheSame) {
    CommandWorld world;
    world.makeAccount();
    world.add("Ada");
    world.done({"publish"});
    Neighbour bob(world, "bob", false);
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    EXPECT_EQ(bob.json({"list", "--of", "alice"}).size(), 1U);
    bob.done({"unsubscribe", "alice"});
    EXPECT_EQ(bob.json({"list"}), nlohmann::json::array());
}

TEST(SubscribingWithoutAnAccount, SaysHowToMakeOne) {
    CommandWorld world;
    EXPECT_TRUE(saysOnce(world.rolvane({"subscribe", "alice"}), kNoSuchThing, "rolvane setup"));
    EXPECT_TRUE(saysOnce(world.rolvane({"share", "alice"}), kNoSuchThing, "rolvane setup"));
    EXPECT_TRUE(saysOnce(world.rolvane({"rights", "alice"}), kNoSuchThing, "rolvane setup"));
}

} // namespace
} // namespace rolvane::test
