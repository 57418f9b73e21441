#include "CommandWorld.h"

#include "foundation/Preferences.h"

#include <filesystem>
#include <fstream>

namespace rolvane::test {
namespace {

using Names = std::set<std::string>;

// The store answers 500 to the removal of what the test names, and does as it is told otherwise.
class Withdrawing : public testing::Test {
protected:
    Withdrawing() {
        world.storeConfiguration = {"LoadModule rewrite_module /usr/lib/apache2/modules/mod_rewrite.so",
                                    "RewriteEngine on"};
        const std::map<std::string, std::string> rules{{"tree", "/Contacts/?$"}, {"people", "/Contacts/People/"}};
        for (const auto& [name, path] : rules)
            world.storeConfiguration.insert(world.storeConfiguration.end(), {"RewriteCond %{REQUEST_METHOD} =DELETE",
                                                                             "RewriteCond \"" + flag(name) + "\" -f",
                                                                             "RewriteRule \"" + path + "\" - [R=500]"});
        world.bus();
        world.makeAccount();
        for (const char* name : {"Ada", "Bob", "Cid"}) uids[name] = world.add(name);
    }
    std::string flag(const std::string& what) { return world.home / ("store/root/dav/no-removal-of-" + what); }
    void storeFailsAt(const std::string& what) { ASSERT_TRUE(std::ofstream(flag(what))); }
    void storeWorksAgain() {
        for (const char* what : {"tree", "people"}) std::filesystem::remove(flag(what));
    }
    bool anythingLeft() { return world.json({"status"})["leftOnStore"].get<bool>(); }
    void publishTwoGroups() {
        world.group("Family", {"Ada", "Bob"});
        world.group("Work", {"Bob", "Cid"});
        world.done({"publish", "--group", "Family"});
        world.done({"publish", "--group", "Work"});
    }
    // As a command leaves it that was killed before the end.
    void noteTheTree() {
        Preferences preferences(world.home / "state/rolvane/preferences.db");
        const std::string location = world.json({"status"})["store"]["location"];
        preferences.set(kDaemonDomain, "CXDLeftOnStore", Dictionary{{location, Dictionary{{"tree", true}}}});
        preferences.synchronize(kDaemonDomain);
    }
    const Names family{"AllCXGroup", "Family", "People/Ada", "People/Bob", "dateFile", "info"};
    std::map<std::string, std::string> uids;
    CommandWorld world;
};

TEST_F(Withdrawing, IsToldAsADocument) {
    publishTwoGroups();
    EXPECT_EQ(world.json({"unpublish", "--yes", "--group", "Work"}),
              (nlohmann::json{{"group", "Work"}, {"stillPublished", true}, {"removedFromStore", true}}));
    EXPECT_EQ(world.json({"unpublish", "--yes", "--keep"}),
              (nlohmann::json{{"group", nullptr}, {"stillPublished", false}, {"removedFromStore", false}}));
    EXPECT_FALSE(world.tree().empty());
}

TEST_F(Withdrawing, ThatFailsInTheMiddleIsFinishedByTheNextPublication) {
    world.done({"publish"});
    storeFailsAt("tree");
    EXPECT_TRUE(saysOnce(world.rolvane({"unpublish", "--yes"}), kFailure,
                         "could not be removed from the store (it answered 500)"));
    EXPECT_TRUE(anythingLeft());
    EXPECT_NE(world.done({"status"}).find("still on the store"), std::string::npos);
    for (const std::string& path : world.tree()) // it had come some way
        if (path.ends_with(uids["Bob"]) || path == "info") std::filesystem::remove(world.published(path));
    world.done({"delete", "--yes", "Ada"});

    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kFailure, "Nothing was published"));
    EXPECT_EQ(world.json({"status"})["published"]["everything"], false);
    storeWorksAgain();
    world.done({"publish"});
    EXPECT_EQ(world.namedTree(), (Names{"AllCXGroup", "People/Bob", "People/Cid", "computers", "dateFile", "info"}));
    EXPECT_FALSE(anythingLeft());
    EXPECT_EQ(world.json({"list"}).size(), 2U) << "the contacts stay";
}

TEST_F(Withdrawing, ThatFailsIsFinishedWhenItIsRepeated) {
    world.done({"publish"});
    storeFailsAt("tree");
    EXPECT_EQ(world.rolvane({"unpublish", "--yes"}).status, kFailure);
    world.store().stop(PrivateStore::Stop::atOnce);
    EXPECT_TRUE(saysOnce(world.rolvane({"unpublish", "--yes"}), kNotReached, "it did not answer"));
    world.store().start();
    storeWorksAgain();
    world.done({"unpublish", "--yes"});
    EXPECT_EQ(world.tree(), Names{});
    EXPECT_FALSE(anythingLeft());
}

TEST_F(Withdrawing, OfAGroupThatFailsInTheMiddleIsFinishedWhenItIsRepeated) {
    publishTwoGroups();
    storeFailsAt("people");
    EXPECT_TRUE(saysOnce(world.rolvane({"unpublish", "--yes", "--group", "Work"}), kFailure, "a contact of the group"));
    EXPECT_TRUE(world.namedTree().contains("People/Cid"));
    EXPECT_TRUE(world.daemon()) << "it serves what is still published";
    storeWorksAgain();
    world.done({"unpublish", "--yes", "--group", "Work"});
    EXPECT_EQ(world.namedTree(), family);
    EXPECT_FALSE(anythingLeft());
    EXPECT_TRUE(
        saysOnce(world.rolvane({"unpublish", "--yes", "--group", "Work"}), kNoSuchThing, "not published by itself"));
    EXPECT_TRUE(world.daemon());
}

TEST_F(Withdrawing, OfAGroupThatFailsInTheMiddleIsFinishedByTheNextPublication) {
    publishTwoGroups();
    storeFailsAt("people");
    EXPECT_EQ(world.rolvane({"unpublish", "--yes", "--group", "Work"}).status, kFailure);
    storeWorksAgain();
    world.done({"delete", "--yes", "Cid"});
    world.done({"publish", "--group", "Work"});
    EXPECT_EQ(world.namedTree(),
              (Names{"AllCXGroup", "Family", "Work", "People/Ada", "People/Bob", "dateFile", "info"}));
    EXPECT_FALSE(anythingLeft());
}

TEST_F(Withdrawing, LeavesWhoHasComeIntoAnotherPublishedGroupBeforeItWasFinished) {
    publishTwoGroups();
    storeFailsAt("people");
    EXPECT_EQ(world.rolvane({"unpublish", "--yes", "--group", "Work"}).status, kFailure);
    storeWorksAgain();
    world.done({"group", "add", "Family", "Cid"});
    world.done({"sync"});
    world.done({"unpublish", "--yes", "--group", "Work"});
    Names withCid = family;
    withCid.insert("People/Cid");
    EXPECT_EQ(world.namedTree(), withCid);
}

TEST_F(Withdrawing, OfTheLastGroupThatFailsIsFinishedByTheSameCommand) {
    world.group("Family", {"Ada", "Bob"});
    world.done({"publish", "--group", "Family"});
    storeFailsAt("tree");
    EXPECT_EQ(world.rolvane({"unpublish", "--yes", "--group", "Family"}).status, kFailure);
    storeWorksAgain();
    world.done({"unpublish", "--yes", "--group", "Family"});
    EXPECT_EQ(world.tree(), Names{});
}

TEST_F(Withdrawing, ThatFailedAndIsRepeatedWithKeepLeavesTheFiles) {
    world.done({"publish"});
    storeFailsAt("tree");
    EXPECT_EQ(world.rolvane({"unpublish", "--yes"}).status, kFailure);
    storeWorksAgain();
    world.done({"unpublish", "--yes", "--keep"});
    EXPECT_TRUE(world.namedTree().contains("People/Ada"));
    EXPECT_FALSE(anythingLeft());
}

TEST_F(Withdrawing, ThatWasKilledBeforeItTookAnythingAwayIsFinished) {
    world.done({"publish"});
    world.done({"unpublish", "--yes", "--keep"});
    noteTheTree();
    EXPECT_TRUE(anythingLeft());
    world.done({"delete", "--yes", "Ada"});
    world.done({"publish"});
    EXPECT_EQ(world.namedTree(), (Names{"AllCXGroup", "People/Bob", "People/Cid", "computers", "dateFile", "info"}));
    EXPECT_FALSE(anythingLeft());
}

TEST_F(Withdrawing, ThatWasKilledBeforeItWasSavedTakesNothingOffTheStore) {
    world.done({"publish"});
    const std::string before = contentsOf(world.published("info"));
    noteTheTree();
    EXPECT_FALSE(anythingLeft());
    world.done({"publish"});
    EXPECT_EQ(contentsOf(world.published("info")), before) << "it is the same tree";
    EXPECT_TRUE(world.namedTree().contains("People/Ada"));
    world.done({"unpublish", "--yes"});
    EXPECT_EQ(world.tree(), Names{});
    EXPECT_FALSE(anythingLeft());
}

} // namespace
} // namespace rolvane::test
