#include "CommandWorld.h"

#include <set>

namespace rolvane::test {
namespace {

struct Seeing : testing::Test {
    CommandWorld world;
    Seeing() {
        world.makeAccount();
        world.store().addUser("bob", "a long and other word");
        world.add("Ada");
        world.add("Cleo");
        world.group("Family", {"Ada"});
    }
};

TEST_F(Seeing, NobodySeesWhatIsNotPublishedOrNotShared) {
    EXPECT_EQ(world.json({"who", "Ada"})["through"], nlohmann::json::array());
    EXPECT_NE(world.rolvane({"who", "Ada"}).errors.find("Nobody but you"), std::string::npos);
    EXPECT_TRUE(saysOnce(world.rolvane({"preview", "bob"}), kNoSuchThing, "nothing is published"));
    world.done({"publish", "--no-daemon"});
    EXPECT_NE(world.rolvane({"who", "Ada"}).errors.find("you share with nobody"), std::string::npos);
    EXPECT_TRUE(saysOnce(world.rolvane({"preview", "bob"}), kNoSuchThing, "you do not share with them"));
    EXPECT_TRUE(saysOnce(world.rolvane({"who", "Nobody"}), kNoSuchThing, "There is no person"));
}

TEST_F(Seeing, AReaderOfAGroupSeesItsMembersAndOfEverythingEverybody) {
    world.done({"publish", "--group", "Family", "--no-daemon"});
    world.done({"share", "bob", "--no-daemon"});
    EXPECT_EQ(world.done({"who", "Ada"}), "bob  read, through Family\n");
    EXPECT_EQ(world.done({"who", "Cleo"}), "");
    nlohmann::json seen = world.json({"preview", "bob"});
    ASSERT_EQ(seen["people"].size(), 1U);
    EXPECT_EQ(seen["people"][0]["name"], "Ada");
    EXPECT_EQ(seen["groups"][0]["members"], 1);
    world.done({"publish", "--no-daemon", "--yes"});
    world.done({"share", "bob", "--write", "--no-daemon"});
    EXPECT_EQ(world.done({"who", "Cleo"}), "bob  read and write, through all your contacts\n");
    seen = world.json({"preview", "bob"});
    EXPECT_EQ(seen["people"].size(), 2U);
    EXPECT_EQ(seen["rights"], "write");
    EXPECT_EQ(world.done({"preview", "bob"}), "Family  (1 member)\nAda\nCleo\n");
}

// What is said before is what lies on the store then.
TEST_F(Seeing, ThePreviewIsWhatIsPublished) {
    world.add("Eve");
    world.group("Cousins", {"Cleo"});
    world.done({"group", "add-group", "Family", "Cousins"});
    const auto peopleOf = [&] {
        std::set<std::string> names;
        for (const std::string& path : world.namedTree())
            if (path.starts_with("People/")) names.insert(path.substr(7));
        return names;
    };
    const auto previewed = [&] {
        std::set<std::string> names;
        const nlohmann::json told = world.json({"preview", "bob"});
        for (const auto& person : told["people"]) names.insert(person["name"]);
        return names;
    };
    world.done({"publish", "--group", "Family"});
    world.done({"share", "bob"});
    EXPECT_EQ(previewed(), peopleOf());
    world.done({"publish", "--yes"});
    EXPECT_EQ(previewed(), peopleOf());
    EXPECT_EQ(previewed().size(), 3U);
}

} // namespace
} // namespace rolvane::test
