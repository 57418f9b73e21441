#include "Neighbour.h"
#include "TerminalSession.h"

#include <filesystem>

namespace rolvane::test {
namespace {

// Alice with two people, one in a group, and bob beside her.
struct Consent : testing::Test {
    CommandWorld world;
    Neighbour bob{world, "bob"};
    Consent() {
        world.makeAccount();
        world.add("Ada");
        world.add("Cleo");
        world.group("Family", {"Ada"});
    }
    // The question's answer at a terminal; gives the exit code.
    static int answered(const std::vector<std::string>& environment, const std::string& command,
                        const std::string& question, const std::string& answer) {
        TerminalSession session(quotedForShell(UserWorld::rolvaneProgram()) + " " + command, environment);
        EXPECT_TRUE(session.answer(question + " [y/N] ", answer));
        return session.end();
    }
    int answered(const std::string& command, const std::string& question, const std::string& answer) {
        return answered(world.home.environment(), command, question, answer);
    }
    // In a pipe the command is refused whatever the pipe says, and nothing but the one line is told.
    template <class Who>
    static void expectRefused(Who& who, const std::vector<std::string>& command, const std::string& question) {
        for (const char* input : {"", "y\n", "n\n"}) {
            const Ran ran = who.rolvane(command, input);
            EXPECT_TRUE(saysOnce(ran, kNotAllowed, question)) << ran;
            EXPECT_NE(ran.errors.find("--yes"), std::string::npos) << ran;
        }
    }
    std::set<std::string> namesListed() {
        std::set<std::string> names;
        for (const auto& person : world.json({"list"})) names.insert(person["name"]);
        return names;
    }
};

TEST_F(Consent, NobodyIsDeletedWithoutIt) {
    expectRefused(world, {"delete", "Ada"}, "Delete 1 person (Ada)?");
    expectRefused(world, {"delete", "Ada", "Cleo", "Ada"}, "Delete 2 people?");
    EXPECT_EQ(answered("delete Ada", "Delete 1 person (Ada)?", "n"), kNotAllowed);
    EXPECT_EQ(answered("delete Ada", "Delete 1 person (Ada)?", ""), kNotAllowed);
    EXPECT_EQ(namesListed(), (std::set<std::string>{"Ada", "Cleo"}));
    EXPECT_EQ(answered("delete Ada", "Delete 1 person (Ada)?", "y"), kDone);
    EXPECT_EQ(namesListed(), std::set<std::string>{"Cleo"});
    world.done({"delete", "Cleo", "--yes"}, "n\n");
    EXPECT_EQ(namesListed(), std::set<std::string>{});
}

TEST_F(Consent, WhoeverDeletesIsToldWhoLosesItToo) {
    world.done({"publish", "--no-daemon"});
    world.done({"share", "bob", "--no-daemon"});
    expectRefused(world, {"delete", "Ada"}, "1 user who reads your contacts loses it, too.");
}

TEST_F(Consent, NoGroupIsDeletedWithoutIt) {
    expectRefused(world, {"group", "delete", "Family"}, "Delete the group \"Family\" with 1 member?");
    EXPECT_EQ(answered("group delete Family", "The members stay.", "n"), kNotAllowed);
    EXPECT_EQ(world.json({"group", "list"}).size(), 1U);
    EXPECT_EQ(answered("group delete Family", "The members stay.", "yes"), kDone);
    EXPECT_EQ(world.json({"group", "list"}).size(), 0U);
}

TEST_F(Consent, NobodyGetsToSeeMorePeopleWithoutIt) {
    world.done({"publish", "--group", "Family"});
    world.done({"share", "bob"});
    world.done({"publish", "--group", "Family"}); // shows nobody anything new
    const auto before = world.namedTree();
    const std::string question = "Publish all contacts? 1 person becomes readable for 1 user (bob).";
    expectRefused(world, {"publish"}, question);
    EXPECT_EQ(answered("publish", question, "n"), kNotAllowed);
    EXPECT_EQ(world.namedTree(), before);
    EXPECT_EQ(world.json({"preview", "bob"})["people"].size(), 1U);
    EXPECT_EQ(answered("publish", question, "y"), kDone);
    EXPECT_TRUE(world.namedTree().contains("People/Cleo"));
    world.done({"publish"});
}

TEST_F(Consent, NothingLeavesTheStoreWithoutIt) {
    world.done({"unpublish"}); // nothing is there
    world.done({"publish"});
    const auto before = world.namedTree();
    const std::string unshared = "Take off the store 2 people and 1 group? You share with nobody.";
    expectRefused(world, {"unpublish"}, unshared);
    world.done({"share", "bob"});
    const std::string shared = "Take off the store 2 people and 1 group? 1 user (bob) loses them.";
    EXPECT_EQ(answered("unpublish", shared, "n"), kNotAllowed);
    expectRefused(
        world, {"unpublish", "--keep"},
        "Stop publishing 2 people and 1 group? 1 user (bob) gets no more news of them; the files stay there.");
    EXPECT_EQ(world.namedTree(), before);
    EXPECT_EQ(answered("unpublish", shared, "y"), kDone);
    EXPECT_EQ(world.tree(), std::set<std::string>{});
}

TEST_F(Consent, OnlyAGroupThatLeavesTheStoreIsAskedAbout) {
    world.done({"publish", "--group", "Family"});
    expectRefused(world, {"unpublish", "--group", "Family"}, "Take off the store 1 person and 1 group?");
    world.done({"publish", "--yes"});
    world.done({"unpublish", "--group", "Family"}); // stays there, as a part of all
    EXPECT_TRUE(world.namedTree().contains("People/Ada"));
}

// Whoever withdraws for a day need not remember with whom everything was shared.
TEST_F(Consent, TheSharesAreThereForTheNextPublicationUnlessToldOtherwise) {
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    world.done({"unpublish", "--yes"});
    EXPECT_EQ(world.json({"shares"})[0]["rights"], "write");
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
    expectRefused(world, {"publish"}, "2 people and 1 group become readable for 1 user (bob).");
    world.done({"publish", "--yes"});
    EXPECT_EQ(bob.json({"rights", "alice"})["write"], true);
    EXPECT_EQ(world.json({"shares"})[0]["agrees"], true);
    world.done({"unpublish", "--yes"});
    EXPECT_NE(world.rolvane({"unshare", "bob"}).errors.find("will not read what you publish next"), std::string::npos);
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
    world.done({"publish"});
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
    world.done({"share", "bob"});
    world.done({"unpublish", "--yes", "--forget-shares"});
    world.done({"publish"});
    EXPECT_EQ(world.json({"shares"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
}

TEST_F(Consent, EditsThatWereNotSentAreNotDroppedWithoutIt) {
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    bob.done({"daemon", "stop"});
    bob.done({"edit", "Ada", "--note", "never sent"});
    const std::string question = "1 change of yours has not been sent yet, and is dropped.";
    expectRefused(bob, {"unsubscribe", "alice"}, question);
    EXPECT_EQ(answered(bob.environment(), "unsubscribe alice", question, "n"), kNotAllowed);
    EXPECT_EQ(bob.json({"show", "Ada"})["properties"]["Note"], "never sent");
    EXPECT_EQ(answered(bob.environment(), "unsubscribe alice", question, "y"), kDone);
    EXPECT_EQ(bob.json({"list"}), nlohmann::json::array());
}

TEST_F(Consent, WhatWasWithdrawnIsNotForgottenWithoutIt) {
    world.done({"publish"});
    world.done({"share", "bob"});
    bob.done({"subscribe", "alice"});
    world.done({"unshare", "bob"});
    EXPECT_EQ(bob.rolvane({"sync"}).status, kNotAllowed);
    const std::string question = "Delete what is kept of alice, 2 people and 1 group?";
    expectRefused(bob, {"withdrawn", "forget", "alice"}, question);
    const std::string file = bob.json({"withdrawn", "list"})[0]["file"];
    EXPECT_EQ(answered(bob.environment(), "withdrawn forget alice", "no other copy here.", "n"), kNotAllowed);
    EXPECT_TRUE(std::filesystem::exists(file));
    EXPECT_EQ(answered(bob.environment(), "withdrawn forget alice", "no other copy here.", "y"), kDone);
    EXPECT_FALSE(std::filesystem::exists(file));
}

TEST_F(Consent, NobodyLosesAnAccountOnTheStoreWithoutIt) {
    const std::string directory = world.home / "own-store";
    world.done({"store", "start", "--directory", directory});
    ASSERT_EQ(world.rolvane({"store", "user", "add", "carl", "--directory", directory}, "a word\n").status, kDone);
    const std::string command = "store user remove carl --directory " + directory,
                      question = "Take the account of carl away? 0 files";
    expectRefused(world, {"store", "user", "remove", "carl", "--directory", directory}, question);
    EXPECT_EQ(answered(command, "nobody signs in as carl any more.", "n"), kNotAllowed);
    EXPECT_EQ(world.json({"store", "user", "list", "--directory", directory}).size(), 1U);
    EXPECT_EQ(answered(command, "nobody signs in as carl any more.", "y"), kDone);
    EXPECT_EQ(world.json({"store", "user", "list", "--directory", directory}).size(), 0U);
    world.done({"store", "stop", "--now", "--directory", directory});
}

} // namespace
} // namespace rolvane::test
