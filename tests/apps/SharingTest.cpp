#include "CommandWorld.h"

#include <csignal>
#include <fstream>
#include <functional>

namespace rolvane::test {
namespace {

using Names = std::set<std::string>;

class Sharing : public testing::Test {
protected:
    Sharing() {
        world.bus();
        world.makeAccount();
    }
    // Waits for what the daemon does by itself a moment after a command has returned.
    testing::AssertionResult comesTrue(const std::function<bool()>& test) {
        for (int i = 0; i < 1500; ++i) {
            if (test()) return testing::AssertionSuccess();
            world.run({"sleep", "0.02"});
        }
        return testing::AssertionFailure() << "it did not within half a minute";
    }
    CommandWorld world;
};

TEST_F(Sharing, PublishReturnsWhenEverythingIsOnTheStore) {
    world.add("Ada");
    world.add("Bob");
    world.group("Family", {"Ada"});
    const Ran ran = world.rolvane({"publish"});
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_EQ(ran.output, "");
    EXPECT_NE(ran.errors.find("Everything is on the store."), std::string::npos) << ran;
    EXPECT_EQ(world.namedTree(),
              (Names{"AllCXGroup", "Family", "People/Ada", "People/Bob", "computers", "dateFile", "info"}));
    EXPECT_TRUE(world.daemon());
    const auto status = world.json({"status"});
    EXPECT_EQ(status["published"]["everything"], true);
    EXPECT_EQ(status["pending"], 0);
    EXPECT_EQ(status["people"], 2);
    EXPECT_EQ(status["groups"], 1);
    EXPECT_EQ(status["store"]["reachable"], true);
    EXPECT_FALSE(status["lastPass"].is_null());
}

TEST_F(Sharing, PublishingTwiceIsNoError) {
    world.add("Ada");
    world.done({"publish"});
    const Ran again = world.rolvane({"publish"});
    EXPECT_EQ(again.status, kDone) << again;
    EXPECT_NE(again.errors.find("already"), std::string::npos) << again;
}

TEST_F(Sharing, AnEditIsOnTheStoreSoonAfter) {
    world.add("Ada");
    world.done({"publish"});
    world.add("Bob");
    EXPECT_TRUE(comesTrue([&] { return world.namedTree().contains("People/Bob"); }));
    world.done({"delete", "Ada", "--yes"});
    EXPECT_TRUE(comesTrue([&] { return !world.namedTree().contains("People/Ada"); }));
}

TEST_F(Sharing, AGroupByItselfBringsItsMembersAndNothingOfOthers) {
    const std::string ada = world.add("Ada");
    const std::string bob = world.add("Bob");
    const std::string cid = world.add("Cid");
    world.add("Dan");
    world.group("Family", {"Ada", "Bob"});
    world.group("Work", {"Cid"});
    world.done({"publish", "--group", "Family"});
    EXPECT_EQ(world.namedTree(), (Names{"AllCXGroup", "Family", "People/Ada", "People/Bob", "dateFile", "info"}));
    // Nothing that is on the store mentions anybody else.
    for (const std::string& path : world.tree())
        for (const std::string& foreign :
             {cid.substr(0, 36), std::string("Work"), std::string("Cid"), std::string("Dan")})
            EXPECT_EQ(contentsOf(world.published(path)).find(foreign), std::string::npos) << foreign << " in " << path;
    const auto published = world.json({"status"})["published"];
    EXPECT_EQ(published["everything"], false);
    ASSERT_EQ(published["groups"].size(), 1U);
    EXPECT_EQ(published["groups"][0]["name"], "Family");

    world.done({"edit", "Dan", "--nickname", "D"});
    world.done({"edit", "Ada", "--nickname", "Edited"});
    EXPECT_TRUE(comesTrue([&] {
        for (const std::string& path : world.tree())
            if (path.find(ada.substr(0, 36)) != std::string::npos)
                return contentsOf(world.published(path)).find("Edited") != std::string::npos;
        return false;
    }));
    EXPECT_FALSE(world.namedTree().contains("People/Dan"));
}

TEST_F(Sharing, OfAGroupThatIsNotPublishedNoNameMemberOrOwnPersonIsOnTheStore) {
    world.add("Ada");
    world.add("Cid");
    world.group("Family", {"Ada"});
    const std::string secret = world.group("Secret", {"Ada", "Cid"}); // shares a member with the published one
    world.done({"publish", "--group", "Family"});
    EXPECT_FALSE(world.namedTree().contains("People/Cid"));
    EXPECT_EQ(contentsOf(world.published("AllCXGroup")).find(secret.substr(0, 36)), std::string::npos);
    const std::string state = contentsOf(world.published(secret));
    EXPECT_EQ(state.find("Secret"), std::string::npos) << state;
    EXPECT_TRUE(state.empty() || state.find("<key>memberUIDState</key>\n\t<array/>") != std::string::npos) << state;
}

TEST_F(Sharing, WithdrawingAGroupTakesItsFilesAndThePeopleThatAreOnlyInItOffTheStore) {
    world.add("Ada");
    world.add("Bob");
    world.add("Cid");
    world.group("Family", {"Ada", "Bob"});
    world.group("Work", {"Bob", "Cid"});
    world.done({"publish", "--group", "Family"});
    world.done({"publish", "--group", "Work"});
    EXPECT_EQ(world.namedTree(),
              (Names{"AllCXGroup", "Family", "Work", "People/Ada", "People/Bob", "People/Cid", "dateFile", "info"}));
    world.done({"unpublish", "--yes", "--group", "Work"});
    EXPECT_EQ(world.namedTree(), (Names{"AllCXGroup", "Family", "People/Ada", "People/Bob", "dateFile", "info"}));
    EXPECT_EQ(world.json({"status"})["published"]["groups"].size(), 1U);
    world.done({"unpublish", "--yes", "--group", "Family"});
    EXPECT_EQ(world.namedTree(), Names{});
    EXPECT_TRUE(world.json({"status"})["published"]["groups"].empty());
}

TEST_F(Sharing, WithdrawingEverythingTakesTheWholeTreeAway) {
    world.add("Ada");
    world.group("Family", {"Ada"});
    world.done({"publish"});
    ASSERT_FALSE(world.tree().empty());
    world.done({"unpublish", "--yes"});
    EXPECT_EQ(world.tree(), std::set<std::string>{});
    EXPECT_EQ(world.json({"list"}).size(), 1U) << "the contacts stay";
    world.done({"publish"});
    EXPECT_TRUE(world.namedTree().contains("People/Ada")) << "and can be published anew";
}

TEST_F(Sharing, KeepLeavesTheFiles) {
    world.add("Ada");
    world.done({"publish"});
    world.done({"unpublish", "--yes", "--keep"});
    EXPECT_TRUE(world.namedTree().contains("People/Ada"));
}

TEST_F(Sharing, UnpublishOfWhatIsNotPublishedSaysSo) {
    world.add("Ada");
    world.group("Family", {"Ada"});
    EXPECT_TRUE(
        saysOnce(world.rolvane({"unpublish", "--yes", "--group", "Family"}), kNoSuchThing, "not published by itself"));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish", "--group", "Nowhere"}), kNoSuchThing, "Nowhere"));
}

TEST_F(Sharing, AGroupThatIsPublishedByItselfIsNotDeletedUnnoticed) {
    world.add("Ada");
    world.group("Family", {"Ada"});
    world.done({"publish", "--group", "Family"});
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "delete", "Family", "--yes"}), kNotAllowed, "unpublish"));
    world.done({"unpublish", "--yes", "--group", "Family"});
    world.done({"group", "delete", "Family", "--yes"});
}

TEST_F(Sharing, WhileTheStoreIsAwayChangesWaitAndASyncBringsThem) {
    world.add("Ada");
    world.done({"publish"});
    world.store().stop(PrivateStore::Stop::atOnce);
    world.add("Bob");
    EXPECT_TRUE(comesTrue([&] { return world.json({"status"})["pending"].get<int>() > 0; }));
    const Ran away = world.rolvane({"sync"});
    EXPECT_EQ(away.status, kNotReached) << away;
    EXPECT_NE(away.errors.find("sent when the store can be reached"), std::string::npos) << away;
    world.store().start();
    const Ran back = world.rolvane({"sync"});
    EXPECT_EQ(back.status, kDone) << back;
    EXPECT_TRUE(world.namedTree().contains("People/Bob"));
    EXPECT_EQ(world.json({"status"})["pending"], 0);
}

TEST_F(Sharing, SyncWithoutADaemonMakesOnePassAndLeavesNoneBehind) {
    world.add("Ada");
    world.done({"publish", "--no-daemon"});
    EXPECT_FALSE(world.daemon());
    EXPECT_EQ(world.tree(), std::set<std::string>{});
    world.done({"sync"});
    EXPECT_TRUE(world.namedTree().contains("People/Ada"));
    EXPECT_FALSE(world.daemon());
}

TEST_F(Sharing, SyncWithNothingSharedSaysThatThereIsNothingToDo) {
    const Ran ran = world.rolvane({"sync"});
    EXPECT_EQ(ran.status, kDone) << ran;
    EXPECT_NE(ran.errors.find("nothing to bring up to date"), std::string::npos) << ran;
}

TEST_F(Sharing, WatchEndsWithThePassAndTellsItsProgress) {
    world.add("Ada");
    world.done({"publish"});
    const auto watching = world.startRolvane({"watch", "--json", "--once", "--seconds", "60"});
    ASSERT_TRUE(watching->waitForLine("watching")) << watching->errors();
    world.done({"edit", "Ada", "--note", "new"});
    const auto ending = watching->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(kDone)) << watching->errors();
    std::istringstream lines(watching->output());
    std::vector<nlohmann::json> events;
    for (std::string line; std::getline(lines, line);) events.push_back(nlohmann::json::parse(line));
    ASSERT_GE(events.size(), 3U) << watching->output();
    EXPECT_EQ(events.back()["event"], "ended");
    EXPECT_EQ(events.back()["pass"]["sent"], true);
    bool progress = false;
    for (const auto& event : events)
        if (event["event"] == "progress") {
            progress = true;
            EXPECT_EQ(event["location"], "local");
            EXPECT_GT(event["fraction"].get<double>(), 0);
        }
    EXPECT_TRUE(progress) << watching->output();
}

TEST_F(Sharing, WatchGivesUpWhenTheTimeIsOverAndEndsInOrderWhenInterrupted) {
    EXPECT_TRUE(saysOnce(world.rolvane({"watch", "--once", "--seconds", "0.1"}), kNotReached, "No pass ended"));
    const auto watching = world.startRolvane({"watch", "--json"});
    ASSERT_TRUE(watching->waitForLine("watching"));
    watching->signal(SIGINT);
    const auto ending = watching->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(kDone));
}

TEST_F(Sharing, TheDaemonIsStartedFoundRestartedAndStopped) {
    EXPECT_EQ(world.json({"daemon", "status"}, kNoSuchThing),
              (nlohmann::json{{"running", false}, {"process", nullptr}}));
    world.done({"daemon", "start"});
    const auto first = world.daemon();
    ASSERT_TRUE(first);
    EXPECT_EQ(world.json({"daemon", "status"}), (nlohmann::json{{"running", true}, {"process", *first}}));
    EXPECT_NE(world.rolvane({"daemon", "start"}).errors.find("runs already"), std::string::npos);
    EXPECT_EQ(world.daemon(), first);
    world.done({"daemon", "restart"});
    const auto second = world.daemon();
    ASSERT_TRUE(second);
    EXPECT_NE(second, first);
    world.done({"daemon", "stop"});
    EXPECT_FALSE(world.daemon());
    EXPECT_NE(world.rolvane({"daemon", "stop"}).errors.find("was not running"), std::string::npos);
}

TEST_F(Sharing, StatusOffersTheDaemonOnlyWhereItHasSomethingToDo) {
    world.add("Ada");
    std::string shown = world.done({"status"});
    EXPECT_EQ(shown.find("daemon start"), std::string::npos) << shown;
    EXPECT_NE(shown.find("nothing is shared"), std::string::npos) << shown;
    world.done({"publish"});
    world.done({"daemon", "stop"});
    shown = world.done({"status"});
    EXPECT_NE(shown.find("not running (`rolvane daemon start`)"), std::string::npos) << shown;
}

TEST(WithoutABus, PublishSyncAndWatchWorkAllTheSame) {
    CommandWorld world;
    world.makeAccount();
    world.add("Ada");
    world.done({"publish"});
    EXPECT_TRUE(world.namedTree().contains("People/Ada"));
    auto watching = world.startRolvane({"watch", "--once", "--json"});
    ASSERT_TRUE(watching->waitForLine("watching")) << watching->errors();
    world.done({"sync"});
    const auto ending = watching->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0)) << watching->errors();
}

TEST(WithoutADaemonProgram, StartingItSaysHowToNameIt) {
    CommandWorld world;
    const std::string copy = world.home / "bin";
    ASSERT_EQ(world.run({"mkdir", copy}).status, 0);
    ASSERT_EQ(world.run({"ln", UserWorld::rolvaneProgram(), copy + "/rolvane"}).status == 0 ||
                  world.run({"cp", UserWorld::rolvaneProgram(), copy + "/rolvane"}).status == 0,
              true);
    world.home.setVariable("ROLVANE_MANAGER", world.home / "missing");
    EXPECT_TRUE(saysOnce(world.run({copy + "/rolvane", "daemon", "start"}), kFailure, "ROLVANE_MANAGER"));
}

// The private store's commands -----------------------------------------------------------------------------------

TEST(StoreCommands, AStoreIsStartedDescribedFilledWithUsersAndStopped) {
    CommandWorld world;
    const std::string directory = world.home / "s";
    const std::vector<std::string> at{"--directory", directory};
    const auto with = [&](std::vector<std::string> command, std::vector<std::string> more = {}) {
        command.insert(command.end(), at.begin(), at.end());
        command.insert(command.end(), more.begin(), more.end());
        return command;
    };
    EXPECT_EQ(world.json(with({"store", "status"}), kNoSuchThing)["running"], false);
    const auto started = world.json(with({"store", "start"}));
    EXPECT_EQ(started["running"], true);
    EXPECT_TRUE(started["endpoint"].get<std::string>().starts_with("https://localhost:"));
    EXPECT_EQ(world.json(with({"store", "start"}))["process"], started["process"]) << "it runs already";
    world.done(with({"store", "user", "add"}, {"alice"}), "secret\n");
    EXPECT_TRUE(saysOnce(world.rolvane(with({"store", "user", "add"}, {"bob"}), "\n"), kWrongLine, "empty"));
    EXPECT_EQ(world.json(with({"store", "user", "list"})), nlohmann::json{"alice"});
    EXPECT_EQ(world.json(with({"store", "status"}))["users"], nlohmann::json{"alice"});
    world.done({"account", "set", "--user", "alice", "--endpoint", started["endpoint"], "--ca-file", started["caFile"],
                "--ask-password"},
               "secret\n");
    EXPECT_EQ(world.rolvane({"account", "test"}).status, kDone);
    world.done(with({"store", "user", "remove", "--yes"}, {"alice"}));
    EXPECT_TRUE(saysOnce(world.rolvane(with({"store", "user", "remove"}, {"alice"})), kNoSuchThing, "alice"));
    world.done(with({"store", "stop"}, {"--now"}));
    EXPECT_EQ(world.json(with({"store", "status"}), kNoSuchThing)["running"], false);
    EXPECT_NE(world.rolvane(with({"store", "stop"})).errors.find("was not running"), std::string::npos);
}

} // namespace
} // namespace rolvane::test
