#include "Neighbour.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/records/Identifier.h"
#include "contacts/records/SharingDates.h"
#include "foundation/Date.h"
#include "support/WaitUntil.h"

#include <csignal>
#include <filesystem>
#include <map>
#include <set>

namespace rolvane::test {
namespace {

class Rights : public testing::Test {
protected:
    Rights() {
        world.bus();
        world.makeAccount();
        world.add("Ada");
        world.add("Bea");
        world.group("Family", {"Ada"});
    }
    static nlohmann::json share(const char* user, const char* rights) {
        return {{"user", user}, {"rights", rights}, {"store", rights}, {"agrees", true}};
    }
    // What `shares` prints, but for the dates.
    nlohmann::json shares() {
        nlohmann::json all = world.json({"shares"});
        for (auto& each : all) {
            each.erase("readsSince");
            each.erase("writesSince");
        }
        return all;
    }
    CommandWorld world;
    Neighbour bob{world, "bob"};
};

TEST_F(Rights, AreGrantedLoweredAndTakenBackAndTheStoreHasThemWhenTheCommandReturns) {
    world.done({"publish"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
    const auto told = world.json({"share", "bob"});
    EXPECT_EQ(told["user"], "bob");
    EXPECT_EQ(told["rights"], "read");
    EXPECT_EQ(told["pass"]["storeReached"], true);
    EXPECT_EQ(told["pass"]["trees"][0]["own"], true);
    EXPECT_EQ(shares(), nlohmann::json::array({share("bob", "read")}));
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], true);
    EXPECT_EQ(bob.json({"rights", "alice"})["write"], false);
    world.done({"share", "bob", "--write"});
    EXPECT_EQ(shares(), nlohmann::json::array({share("bob", "write")}));
    EXPECT_EQ(bob.json({"rights", "alice"})["write"], true);
    world.done({"share", "bob"});
    EXPECT_EQ(shares(), nlohmann::json::array({share("bob", "read")}));
    EXPECT_EQ(bob.json({"rights", "alice"})["write"], false);
    world.done({"unshare", "bob"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
    EXPECT_EQ(bob.done({"rights", "bob"}), "bob  read and write\n");
}

TEST_F(Rights, AreListedWithTheMomentsSinceWhichTheyHold) {
    const auto listed = [&] { return world.json({"shares"})[0]; };
    const auto begins = [](const nlohmann::json& date) { return Date::fromISO8601(date.get<std::string>()).value(); };
    world.home.setVariable("TZ", "UTC0");
    const auto shown = [](const nlohmann::json& date) { // local time
        const std::string text = date.get<std::string>();
        return text.substr(0, 10) + " " + text.substr(11, 8);
    };
    const Date before = Clock::system().now();
    world.done({"publish"});
    world.done({"share", "bob"});
    const auto reads = listed()["readsSince"];
    EXPECT_GE(begins(reads).secondsSince(before), -1);
    EXPECT_GE(Clock::system().now().secondsSince(begins(reads)), 0);
    EXPECT_TRUE(listed()["writesSince"].is_null());
    EXPECT_EQ(world.done({"shares"}), "bob  read  reads since " + shown(reads) + "\n");
    world.done({"share", "bob", "--write"});
    const auto writes = listed()["writesSince"];
    EXPECT_GE(begins(writes).secondsSince(begins(reads)), 0);
    EXPECT_EQ(listed()["readsSince"], reads) << "a raised right has been read with for longer";
    EXPECT_EQ(world.done({"shares"}),
              "bob  read and write  reads since " + shown(reads) + ", writes since " + shown(writes) + "\n");
    world.done({"share", "bob", "--write"});
    EXPECT_EQ(listed()["writesSince"], writes) << "what is granted already keeps its date";
    world.done({"share", "bob"});
    EXPECT_TRUE(listed()["writesSince"].is_null());
    EXPECT_EQ(listed()["readsSince"], reads);
}

// What a version that noted no date has left.
TEST_F(Rights, WithoutADateShowADash) {
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    world.done({"daemon", "stop"});
    {
        CXRolvane::Options options;
        options.path = world.home / "data/rolvane/contacts.db";
        CXRolvane database(options);
        database.allGroup()->removeValueForProperty(kCXReadSharingDatesProperty);
        database.allGroup()->removeValueForProperty(kCXReadWriteSharingDatesProperty);
        database.save();
    }
    EXPECT_EQ(world.done({"shares"}), "bob  read and write  reads since -, writes since -\n");
    EXPECT_TRUE(world.json({"shares"})[0]["readsSince"].is_null());
    world.done({"share", "bob"});
    world.done({"share", "bob", "--write"});
    EXPECT_TRUE(world.json({"shares"})[0]["readsSince"].is_null());
    EXPECT_TRUE(world.json({"shares"})[0]["writesSince"].is_string());
}

TEST_F(Rights, TheDaemonStartsAnewForTheFirstWriterAndTheLastOnly) {
    Neighbour carol(world, "carol");
    world.done({"publish"});
    const auto first = world.daemon();
    ASSERT_TRUE(first);
    world.done({"share", "bob"});
    EXPECT_EQ(world.daemon(), first) << "it is told of readers";
    world.done({"share", "bob", "--write"});
    const auto second = world.daemon();
    EXPECT_NE(second, first) << "what writers send is taken by a daemon that knew of one when it started";
    world.done({"share", "carol", "--write"});
    EXPECT_EQ(world.daemon(), second);
    world.done({"unshare", "carol"});
    EXPECT_EQ(world.daemon(), second);
    world.done({"unshare", "bob"});
    EXPECT_NE(world.daemon(), second);
}

TEST_F(Rights, APublishedGroupIsSharedToo) {
    world.done({"publish", "--group", "Family"});
    world.done({"share", "bob"});
    EXPECT_EQ(shares(), nlohmann::json::array({share("bob", "read")}));
    bob.done({"subscribe", "alice"});
    const auto people = bob.json({"list", "--of", "alice"});
    ASSERT_EQ(people.size(), 1U);
    EXPECT_EQ(people[0]["name"], "Ada");
    world.done({"unshare", "bob"});
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
}

TEST_F(Rights, BeforeAnythingIsPublishedThereIsNothingToShare) {
    EXPECT_TRUE(saysOnce(world.rolvane({"share", "bob"}), kNotAllowed, "`rolvane publish` comes first"));
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
}

TEST_F(Rights, TheOwnersRightsAreNotUpForChange) {
    world.done({"publish"});
    EXPECT_TRUE(saysOnce(world.rolvane({"share", "alice"}), kNotAllowed, "your own account"));
    EXPECT_TRUE(saysOnce(world.rolvane({"unshare", "Alice"}), kNotAllowed, "your own account"));
}

TEST_F(Rights, OfSomebodyWhoHasNoneCannotBeTakenBack) {
    world.done({"publish"});
    EXPECT_TRUE(saysOnce(world.rolvane({"unshare", "bob"}), kNoSuchThing, "do not share with \"bob\""));
}

TEST_F(Rights, OfAUserWhomTheStoreDoesNotKnowTheOwnerLearns) {
    world.done({"publish"});
    const Ran ran = world.rolvane({"share", "bobb"});
    EXPECT_EQ(ran.status, kFailure) << ran;
    EXPECT_NE(ran.errors.find("knows no user \"bobb\""), std::string::npos) << ran;
    const auto shares = world.json({"shares"});
    ASSERT_EQ(shares.size(), 1U);
    EXPECT_EQ(shares[0]["agrees"], false);
    EXPECT_EQ(world.rolvane({"unshare", "bobb"}).status, kDone);
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
}

TEST_F(Rights, WhileTheStoreIsAwayNothingIsChanged) {
    world.done({"publish"});
    world.store().stop(PrivateStore::Stop::atOnce);
    EXPECT_TRUE(saysOnce(world.rolvane({"share", "bob", "--quiet"}), kNotReached, "Nothing was changed"));
    EXPECT_TRUE(saysOnce(bob.rolvane({"rights", "alice", "--quiet"}), kNotReached, ""));
    world.store().start();
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
}

TEST_F(Rights, GoWithThePublication) {
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    world.done({"unpublish", "--yes", "--forget-shares"});
    world.done({"publish"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
}

// The store takes everything but lists: its directory of lists cannot be written.
class RightsOnAFailingStore : public Rights {
protected:
    RightsOnAFailingStore() { world.done({"publish"}); }
    ~RightsOnAFailingStore() override { fails(false); }
    void fails(bool so) {
        std::filesystem::permissions(world.store().stateDirectory() + "/lists",
                                     so ? std::filesystem::perms::owner_read | std::filesystem::perms::owner_exec
                                        : std::filesystem::perms::owner_all);
    }
    void killTheDaemon() {
        const auto process = world.daemon();
        ASSERT_TRUE(process);
        ::kill(*process, SIGKILL);
        ASSERT_TRUE(waitUntil([&] { return !world.daemon(); }, "the end of the daemon"));
    }
};

TEST_F(RightsOnAFailingStore, AGrantThatCouldNotBeSavedIsSavedByTheNextProcess) {
    fails(true);
    EXPECT_EQ(world.rolvane({"share", "bob"}).status, kNotReached);
    killTheDaemon();
    fails(false);
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
    world.done({"sync"});
    EXPECT_EQ(shares(), nlohmann::json::array({share("bob", "read")}));
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], true);
    world.done({"unshare", "bob"});
    world.done({"daemon", "restart"});
    world.done({"sync"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array()) << "what was saved is not saved again";
}

TEST_F(RightsOnAFailingStore, AWithdrawalThatCouldNotBeSavedIsSavedByTheNextProcessAndNotTakenForAGrantOfTheStores) {
    world.done({"share", "bob", "--write"});
    world.done({"daemon", "stop"});
    fails(true);
    world.done({"unshare", "bob", "--no-daemon"});
    world.done({"daemon", "start"});
    EXPECT_EQ(world.rolvane({"sync"}).status, kNotReached) << "the list waits";
    EXPECT_EQ(bob.json({"rights", "alice"})["write"], true) << "the store does not know yet";
    killTheDaemon();
    fails(false);
    world.done({"sync"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
}

TEST_F(RightsOnAFailingStore, AGrantThatWasNeverSavedIsForgottenWithThePublication) {
    fails(true);
    EXPECT_EQ(world.rolvane({"share", "bob"}).status, kNotReached);
    fails(false);
    world.done({"unpublish", "--yes", "--forget-shares"});
    world.done({"publish"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
}

TEST_F(RightsOnAFailingStore, WhatTheStoreDoesNotTakeBackIsNotTakenBackHereEither) {
    world.done({"share", "bob"});
    fails(true);
    const Ran ran = world.rolvane({"unshare", "bob"});
    EXPECT_EQ(ran.status, kFailure) << ran;
    EXPECT_NE(ran.errors.find("Nothing was changed here"), std::string::npos) << ran;
    EXPECT_EQ(shares(), nlohmann::json::array({share("bob", "read")}));
}

TEST(RightsOnAPlainStore, AreWhatItsAdministratorSaysAndShareTellsSo) {
    CommandWorld world;
    PrivateStoreOptions options;
    options.stateDirectory = world.home / "plain";
    options.ownsProcess = true;
    options.accessLists = false;
    PrivateStore plain(options);
    plain.addUser("alice", UserWorld::kPassword);
    plain.start();
    world.done({"account", "set", "--user", "alice", "--endpoint", plain.endpointTemplate(), "--ca-file",
                plain.caFile(), "--ask-password"},
               std::string(UserWorld::kPassword) + "\n");
    world.add("Ada");
    world.done({"publish"});
    EXPECT_TRUE(saysOnce(world.rolvane({"share", "bob"}), kFailure, "keeps no access lists"));
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
}

TEST_F(Rights, AnEditThatCameTooLateIsRefusedToldAndLeavesTheQueue) {
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"}); // the edit waits
    bob.done({"edit", "Ada", "--note", "too late"});
    world.done({"share", "bob"});
    const std::string before = contentsOf(world.published("AllCXGroup"));
    bob.rolvane({"sync"});
    EXPECT_EQ(bob.json({"status"})["pending"], 0);
    const nlohmann::json refused = bob.json({"status"})["refused"];
    ASSERT_EQ(refused.size(), 1U) << refused;
    EXPECT_EQ(refused[0]["user"], "alice");
    EXPECT_EQ(refused[0]["why"], "right");
    EXPECT_GE(refused[0]["changes"], 1);
    const std::string told = bob.done({"status"});
    EXPECT_NE(told.find("does not let you write there. Ask alice for `rolvane share bob --write`"), std::string::npos)
        << told;
    EXPECT_EQ(contentsOf(world.published("AllCXGroup")), before);
    world.done({"sync"});
    EXPECT_EQ(world.done({"show", "Ada"}).find("too late"), std::string::npos);
    bob.done({"sync"});
    EXPECT_EQ(bob.done({"show", "Ada"}).find("too late"), std::string::npos) << "the copy is the publisher's again";
}

TEST_F(Rights, AChangeOfAGroupThatItsPublisherDeletedIsGivenUpAndTold) {
    world.group("Circle", {"Ada"});
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"});
    bob.done({"group", "add", "Circle", "Bea"});
    world.done({"group", "delete", "Circle", "--yes"});
    world.done({"sync"});
    bob.done({"sync"});
    const nlohmann::json status = bob.json({"status"});
    EXPECT_EQ(status["pending"], 0);
    ASSERT_EQ(status["refused"].size(), 1U) << status;
    EXPECT_EQ(status["refused"][0]["user"], "alice");
    EXPECT_EQ(status["refused"][0]["why"], "groupIsGone");
    EXPECT_EQ(status["refused"][0]["group"], "Circle");
    EXPECT_EQ(status["refused"][0]["changes"], 1);
    const std::string told = bob.done({"status"});
    EXPECT_NE(told.find("alice has deleted the group \"Circle\" meanwhile"), std::string::npos) << told;
    world.done({"sync"});
    EXPECT_EQ(world.rolvane({"group", "show", "Circle"}).status, kNoSuchThing) << "it is not made again";
}

// Name -> members, groups in it and choices, of the publisher's groups or of their copies.
template <class Person>
std::map<std::string, nlohmann::json> groupsOf(Person& user, const std::vector<std::string>& whose) {
    std::vector<std::string> command{"group", "list"};
    command.insert(command.end(), whose.begin(), whose.end());
    std::map<std::string, nlohmann::json> all;
    for (const nlohmann::json& group : user.json(command)) {
        nlohmann::json& state = all[group["name"]];
        for (const char* list : {"members", "subgroups"}) {
            std::set<std::string> names;
            for (const std::string uid : group[list]) names.insert(cxNormalizedUID(UniqueId(uid)).str());
            state[list] = names;
        }
        for (const auto& [uid, choice] : group["distribution"].items())
            state["choices"][cxNormalizedUID(UniqueId(uid)).str()] = choice;
    }
    return all;
}

TEST_F(Rights, ChangesOfGroupsThatCameTooLateAreTakenBackInTheCopy) {
    world.group("Friends", {"Bea"});
    world.group("Work", {});
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    const auto before = groupsOf(world, {"--own"});
    ASSERT_EQ(groupsOf(bob, {"--of", "alice"}), before);
    bob.done({"daemon", "stop"});
    bob.done({"group", "rename", "Family", "Clan"});
    bob.done({"group", "remove", "Friends", "Bea"});
    bob.done({"group", "add", "Friends", "Ada"});
    bob.done({"group", "add-group", "Clan", "Friends"});
    bob.done({"delete", "--yes", "Ada"});
    bob.done({"group", "delete", "Work", "--yes"});
    world.done({"share", "bob"});
    bob.rolvane({"sync"});
    EXPECT_GE(bob.json({"status"})["refused"].size(), 1U);
    bob.done({"sync"});
    EXPECT_EQ(groupsOf(world, {"--own"}), before);
    EXPECT_EQ(groupsOf(bob, {"--of", "alice"}), before) << "the copies are the publisher's again";
    EXPECT_NE(bob.done({"show", "Ada"}).find("Ada"), std::string::npos);
    const auto refused = bob.json({"status"})["refused"].size();
    bob.done({"sync"});
    EXPECT_EQ(bob.json({"status"})["refused"].size(), refused) << "nothing is tried again";
    EXPECT_EQ(bob.json({"status"})["pending"], 0);
}

} // namespace
} // namespace rolvane::test
