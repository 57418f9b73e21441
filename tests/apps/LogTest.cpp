#include "Neighbour.h"
#include "TerminalSession.h"

#include "support/WaitUntil.h"

namespace rolvane::test {
namespace {

struct Log : testing::Test {
    CommandWorld world;
    Log() {
        world.add("Ada", {"--phone", "home:1"});
        world.add("Cleo");
        world.group("Family", {"Ada"});
    }
    std::string everything() { return world.done({"export"}); }
    int64_t last() { return world.json({"log"})[0]["number"]; }
};

TEST_F(Log, TellsAChangeAndTakesItBack) {
    const std::string before = everything();
    world.done({"edit", "Ada", "--phone", "home:2", "--note", "x"});
    const std::string told = world.done({"log", "Ada"});
    EXPECT_NE(told.find("here, `rolvane edit`"), std::string::npos) << told;
    EXPECT_NE(told.find("Note: nothing -> x"), std::string::npos) << told;
    EXPECT_NE(told.find("1 -> "), std::string::npos) << told;
    const auto listed = world.json({"log", "Ada"});
    EXPECT_EQ(listed[0]["command"], "edit");
    EXPECT_EQ(listed[0]["details"][0]["kind"], "changed");
    EXPECT_NE(world.rolvane({"undo", "--dry-run"}).errors.find("1 changed back. Nothing was changed"),
              std::string::npos);
    EXPECT_NE(everything(), before);
    EXPECT_NE(world.rolvane({"undo"}).errors.find("1 changed back"), std::string::npos);
    EXPECT_EQ(world.json({"show", "Ada"})["properties"].contains("Note"), false);
    EXPECT_TRUE(saysOnce(world.rolvane({"undo", std::to_string(listed[0]["number"].get<int>())}), kNotAllowed,
                         "taken back already"));
    EXPECT_EQ(world.json({"log"})[1]["takenBack"], true);
    EXPECT_TRUE(saysOnce(world.rolvane({"undo", "4711"}), kNoSuchThing, "no change 4711"));
}

TEST_F(Log, BringsBackWhoWasDeletedWithTheGroups) {
    world.done({"delete", "Ada", "--yes"});
    EXPECT_EQ(world.json({"list"}).size(), 1U);
    EXPECT_NE(world.done({"log", "Ada"}).find("Ada deleted"), std::string::npos);
    world.done({"undo"});
    EXPECT_EQ(world.json({"list"}).size(), 2U);
    EXPECT_EQ(world.json({"list", "--group", "Family"})[0]["name"], "Ada");
    world.done({"group", "delete", "Family", "--yes"});
    world.done({"undo"});
    EXPECT_EQ(world.json({"list", "--group", "Family"})[0]["name"], "Ada");
}

TEST_F(Log, AnImportAndAMergeAreOneChangeEach) {
    const std::string before = everything();
    std::string cards;
    for (int i = 0; i < 1500; i++)
        cards += "BEGIN:VCARD\r\nVERSION:3.0\r\nN:;Imported" + std::to_string(i) + ";;;\r\nFN:Imported" +
                 std::to_string(i) + "\r\nUID:u" + std::to_string(i) + "\r\nCATEGORIES:New\r\nEND:VCARD\r\n";
    world.done({"import", world.write("many.vcf", cards)});
    EXPECT_EQ(world.json({"log"})[0]["people"], 1500);
    EXPECT_EQ(world.json({"undo"})["removed"], 1501) << "with their group";
    EXPECT_EQ(everything(), before);
    world.done({"merge", "Ada", "Cleo"});
    EXPECT_EQ(world.json({"list"}).size(), 1U);
    world.done({"undo"});
    EXPECT_EQ(world.json({"list"}).size(), 2U);
}

TEST_F(Log, GoesBackOneChangeAfterTheOtherToTheFirst) {
    world.add("Eve", {"--note", "one"});
    world.done({"edit", "Eve", "--note", "two"});
    world.done({"edit", "Eve", "--note", "three"});
    world.done({"undo"});
    EXPECT_EQ(world.json({"show", "Eve"})["properties"]["Note"], "two");
    world.done({"undo"});
    EXPECT_EQ(world.json({"show", "Eve"})["properties"]["Note"], "one");
    world.done({"undo"});
    EXPECT_TRUE(saysOnce(world.rolvane({"show", "Eve"}), kNoSuchThing, "There is no person"));
}

TEST_F(Log, ShowsValuesAsPeopleWriteThem) {
    world.done({"edit", "Ada", "--birthday", "1980-12-31", "--address", "home:Main Street 5; 10115; Berlin"});
    const std::string told = world.done({"log", "Ada"});
    EXPECT_NE(told.find("Birthday: nothing -> 1980-12-31\n"), std::string::npos) << told;
    EXPECT_NE(told.find("Home: Main Street 5, 10115, Berlin\n"), std::string::npos) << told;
}

TEST_F(Log, SaysWhatItCouldNotTakeBack) {
    world.done({"edit", "Ada", "--note", "first", "--nickname", "A"});
    const std::string change = std::to_string(last());
    world.done({"edit", "Ada", "--note", "second"});
    const Ran ran = world.rolvane({"undo", change});
    EXPECT_EQ(ran.status, kPart) << ran;
    EXPECT_NE(ran.errors.find("keeps its Note"), std::string::npos) << ran;
    EXPECT_EQ(world.json({"show", "Ada"})["properties"]["Note"], "second");
}

TEST_F(Log, ForgetsAContactOnRequestAlone) {
    world.done({"edit", "Ada", "--note", "private"});
    const Ran refused = world.rolvane({"log", "Ada", "--purge"}, "y\n");
    EXPECT_TRUE(saysOnce(refused, kNotAllowed, "Forget what is kept of Ada in 3 changes?"));
    TerminalSession session(quotedForShell(UserWorld::rolvaneProgram()) + " log Ada --purge", world.home.environment());
    EXPECT_TRUE(session.answer("[y/N] ", "y"));
    EXPECT_EQ(session.end(), kDone);
    EXPECT_EQ(world.json({"log", "Ada"}), nlohmann::json::array());
    EXPECT_EQ(world.json({"show", "Ada"})["properties"]["Note"], "private");
    world.done({"delete", "Cleo", "--yes", "--purge"});
    EXPECT_TRUE(saysOnce(world.rolvane({"log", "Cleo"}), kNoSuchThing, "Cleo"));
    EXPECT_EQ(world.json({"list"}).size(), 1U);
}

TEST_F(Log, IsReadAtATerminalToo) {
    TerminalSession session(quotedForShell(UserWorld::rolvaneProgram()) + " log Ada", world.home.environment());
    EXPECT_EQ(session.end(), kDone);
    EXPECT_NE(session.shown().find("Ada added"), std::string::npos) << session.shown();
    TerminalSession undoing(quotedForShell(UserWorld::rolvaneProgram()) + " undo --dry-run", world.home.environment());
    EXPECT_EQ(undoing.end(), kDone);
    EXPECT_NE(undoing.shown().find("this was a trial"), std::string::npos) << undoing.shown();
}

// A writing subscriber deletes a contact of the owner's; the owner has it again, and so has the subscriber.
TEST_F(Log, ADeletionThatCameFromAnotherIsTakenBackEverywhere) {
    world.makeAccount();
    Neighbour bob(world, "bob");
    world.done({"publish"});
    world.done({"share", "bob", "--write"});
    bob.done({"subscribe", "alice"});
    bob.done({"delete", "Ada", "--yes"});
    bob.done({"sync"});
    ASSERT_TRUE(waitUntil(
        [&] {
            world.rolvane({"sync"});
            return world.json({"list"}).size() == 1;
        },
        "the deletion", 60));
    const auto change = world.json({"log", "Ada"})[0];
    EXPECT_EQ(change["by"], "bob");
    world.done({"undo", std::to_string(change["number"].get<int>())});
    EXPECT_EQ(world.json({"list", "--group", "Family"}).size(), 1U);
    ASSERT_TRUE(waitUntil(
        [&] {
            world.rolvane({"sync"});
            bob.rolvane({"sync"});
            return bob.json({"list"}).size() == 2;
        },
        "Ada at bob's", 60));
    world.done({"sync"});
    EXPECT_EQ(world.json({"list"}).size(), 2U);
}

} // namespace
} // namespace rolvane::test
