#include "CommandWorld.h"

#include <filesystem>
#include <fstream>

namespace rolvane::test {
namespace {

class Contacts : public testing::Test {
protected:
    CommandWorld world;
};

TEST_F(Contacts, AddPrintsTheIdentifierAndShowFindsThePersonByIt) {
    const Ran ran = world.rolvane({"add", "--first", "Ada", "--last", "Miller", "--phone", "mobile:+1 555 0100",
                                   "--email", "work:ada@example.org", "--note", "two\nlines"});
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_EQ(lineCount(ran.output), 1U) << "data is one identifier";
    EXPECT_EQ(ran.errors, "Ada Miller added.\n");
    const std::string uid = ran.output.substr(0, ran.output.size() - 1);
    const auto shown = world.json({"show", uid});
    EXPECT_EQ(shown["identifier"], uid);
    EXPECT_EQ(shown["name"], "Ada Miller");
    EXPECT_NE(world.done({"show", uid}).find("+1 555 0100"), std::string::npos);
    EXPECT_EQ(world.json({"show", uid.substr(0, 8)})["identifier"], uid) << "the start of the identifier is enough";
    EXPECT_EQ(world.json({"show", "ada miller"})["identifier"], uid) << "so is the name, whatever its letter case";
}

TEST_F(Contacts, AddWithoutAnythingIsRefusedAndAddsNobody) {
    EXPECT_TRUE(saysOnce(world.rolvane({"add"}), kWrongLine, "at least one"));
    EXPECT_TRUE(saysOnce(world.rolvane({"add", "--first", "Ada", "--group", "Nowhere"}), kNoSuchThing, "Nowhere"));
    EXPECT_EQ(world.json({"list"}).size(), 0U);
}

TEST_F(Contacts, ListSearchesTextAndGroup) {
    world.add("Ada", {"--last", "Miller", "--email", "work:needle@example.org"});
    world.add("Bob", {"--last", "Miller"});
    world.add("Cid", {"--last", "Other"});
    world.group("Family", {"Bob", "Cid"});
    EXPECT_EQ(world.json({"list"}).size(), 3U);
    EXPECT_EQ(lineCount(world.done({"list"})), 3U);
    EXPECT_EQ(world.json({"list", "miller"}).size(), 2U);
    const auto found = world.json({"list", "needle"});
    ASSERT_EQ(found.size(), 1U);
    EXPECT_EQ(found[0]["name"], "Ada Miller");
    EXPECT_TRUE(found[0]["location"].is_null());
    EXPECT_EQ(world.json({"list", "--group", "Family"}).size(), 2U);
    EXPECT_EQ(world.json({"list", "miller", "--group", "Family"}).size(), 1U);
    EXPECT_TRUE(world.json({"list", "--full"})[0].contains("identifier"));
}

TEST_F(Contacts, EditChangesOneFieldAndAnEmptyTextTakesItAway) {
    const std::string uid = world.add("Ada", {"--note", "first"});
    EXPECT_EQ(world.done({"edit", "Ada", "--note", "second", "--nickname", "Addie"}), uid + "\n");
    EXPECT_NE(world.done({"show", uid}).find("second"), std::string::npos);
    world.done({"edit", uid, "--note", ""});
    EXPECT_EQ(world.done({"show", uid}).find("second"), std::string::npos);
    EXPECT_NE(world.done({"show", uid}).find("Addie"), std::string::npos);
    EXPECT_NE(world.rolvane({"edit", uid, "--nickname", "Addie"}).errors.find("stays as it was"), std::string::npos);
}

TEST_F(Contacts, AnOptionTakesOneValueAndLeavesWhatFollows) {
    world.add("Ada");
    world.done({"edit", "--phone", "home:1", "--phone", "work:2", "Ada"});
    const std::string shown = world.done({"show", "Ada"});
    EXPECT_NE(shown.find('1'), std::string::npos);
    EXPECT_NE(shown.find('2'), std::string::npos);
}

TEST_F(Contacts, DeleteTakesAllOrNone) {
    world.add("Ada");
    world.add("Bob");
    EXPECT_TRUE(saysOnce(world.rolvane({"delete", "Ada", "Nobody", "--yes"}), kNoSuchThing, "Nobody"));
    EXPECT_EQ(world.json({"list"}).size(), 2U);
    world.done({"delete", "Ada", "--yes"});
    EXPECT_EQ(world.json({"list"}).size(), 1U);
}

TEST_F(Contacts, DeleteDoesNotTakeAPartOfANameForAPerson) {
    world.add("Adamantine");
    EXPECT_TRUE(saysOnce(world.rolvane({"delete", "Ada", "--yes"}), kNoSuchThing, "Ada"));
    EXPECT_EQ(world.json({"list"}).size(), 1U);
}

TEST_F(Contacts, ANameThatFitsSeveralIsRefusedAndTheyAreListed) {
    const std::string one = world.add("Ada", {"--last", "Miller"}), two = world.add("Ada", {"--last", "Miller"});
    const Ran ran = world.rolvane({"delete", "Ada Miller", "--yes"});
    EXPECT_EQ(ran.status, kNoSuchThing);
    EXPECT_NE(ran.errors.find(one), std::string::npos) << ran;
    EXPECT_NE(ran.errors.find(two), std::string::npos) << ran;
    EXPECT_EQ(world.json({"list"}).size(), 2U);
}

TEST_F(Contacts, WhatIsExportedComesBackByImport) {
    world.add("Ada", {"--last", "Müller", "--phone", "mobile:+1 555 0100"});
    world.add("字");
    world.group("Family", {"字"});
    for (const char* version : {"3", "4"}) {
        const std::string file = world.home / (std::string("all") + version + ".vcf");
        const Ran ran = world.rolvane({"export", "-o", file, "--vcard", version});
        ASSERT_EQ(ran.status, kDone) << ran;
        EXPECT_EQ(ran.output, "");
        CommandWorld other;
        const auto report = other.json({"import", file});
        EXPECT_EQ(report["imported"], 2);
        EXPECT_EQ(report["bad"], 0);
        EXPECT_EQ(report["groups"], 1);
        EXPECT_EQ(other.json({"list", "--group", "Family"})[0]["name"], "字");
        EXPECT_EQ(other.json({"import", file})["imported"], 0) << "the second time everybody is known";
    }
    EXPECT_EQ(world.done({"export", "Ada Müller"}).find("字"), std::string::npos);
    EXPECT_NE(world.done({"export", "--group", "Family"}).find("字"), std::string::npos);
}

TEST_F(Contacts, AnExportThatFailsLeavesTheFormerFile) {
    const std::string card =
        "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Ada\r\nNOTE:" + std::string(300'000, 'x') + "\r\nEND:VCARD\r\n";
    world.done({"import", world.write("long.vcf", card)});
    const std::string file = world.write("all.vcf", "what was there\n");
    const Ran ran = world.run({"/bin/sh", "-c", "trap '' XFSZ; ulimit -f 128; exec \"$0\" export -q -o \"$1\"",
                               UserWorld::rolvaneProgram(), file});
    EXPECT_EQ(ran.status, kFailure) << ran;
    EXPECT_EQ(lineCount(ran.errors), 1U) << ran;
    EXPECT_EQ(contentsOf(file), "what was there\n");
    for (const auto& entry : std::filesystem::directory_iterator(world.home.path()))
        EXPECT_NE(entry.path().extension(), ".part") << entry;
    EXPECT_TRUE(saysOnce(world.rolvane({"export", "-o", world.home / "missing/all.vcf"}), kFailure, "missing/all.vcf"));
}

TEST_F(Contacts, GroupsAreMadeFilledNestedRenamedAndDeleted) {
    const std::string ada = world.add("Ada"), bob = world.add("Bob");
    const std::string family = world.group("Family", {"Ada"}), cousins = world.group("Cousins");
    world.done({"group", "add", "Family", "Bob"});
    world.done({"group", "add-group", "Family", "Cousins"});
    auto shown = world.json({"group", "show", "Family"});
    EXPECT_EQ(shown["identifier"], family);
    EXPECT_EQ(shown["members"], (nlohmann::json{ada, bob}));
    EXPECT_EQ(world.json({"group", "list"}).size(), 2U);
    EXPECT_EQ(lineCount(world.done({"group", "list"})), 2U);
    EXPECT_NE(world.done({"group", "show", "Family"}).find("Cousins"), std::string::npos);
    world.done({"group", "remove", "Family", "Ada"});
    world.done({"group", "remove-group", "Family", "Cousins"});
    world.done({"group", "rename", "Family", "Kin – 家族"});
    shown = world.json({"group", "show", family});
    EXPECT_EQ(shown["name"], "Kin – 家族");
    EXPECT_EQ(shown["members"], nlohmann::json{bob});
    world.done({"group", "delete", "Cousins", "--yes"});
    EXPECT_EQ(world.json({"group", "list"}).size(), 1U);
    EXPECT_EQ(world.json({"list"}).size(), 2U) << "the members stay";
}

TEST_F(Contacts, GroupCommandsRefuseWhatMakesNoSense) {
    world.add("Ada");
    world.group("Family", {"Ada"});
    world.group("Cousins");
    world.done({"group", "add-group", "Family", "Cousins"});
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "create", "Family"}), kNotAllowed, "already"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "create", ""}), kWrongLine, "name"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "add", "Family", "Nobody"}), kNoSuchThing, "Nobody"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "show", "Nowhere"}), kNoSuchThing, "Nowhere"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "rename", "Family", ""}), kWrongLine, "name"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "delete", "Fam", "--yes"}), kNoSuchThing, "Fam"));
    const Ran ring = world.rolvane({"group", "add-group", "Cousins", "Family"});
    EXPECT_EQ(ring.status, kFailure) << ring;
    EXPECT_NE(ring.errors.find("contain itself"), std::string::npos) << ring;
}

TEST_F(Contacts, AGroupChoosesAMembersValue) {
    world.add("Ada", {"--email", "work:w@example.org", "--email", "home:h@example.org"});
    world.add("Bob", {"--email", "work:b@example.org"});
    world.group("Family", {"Ada"});
    world.done({"group", "choose", "Family", "Ada", "Email", "h@example.org"});
    EXPECT_NE(world.done({"group", "show", "Family"}).find("[Email: h@example.org]"), std::string::npos);
    world.done({"group", "choose", "Family", "Ada", "Email", "--clear"});
    EXPECT_EQ(world.done({"group", "show", "Family"}).find("[Email"), std::string::npos);
    const Ran unknown = world.rolvane({"group", "choose", "Family", "Ada", "Email", "x@example.org"});
    EXPECT_EQ(unknown.status, kNoSuchThing) << unknown;
    EXPECT_NE(unknown.errors.find("w@example.org"), std::string::npos) << "what there is, is listed";
    EXPECT_TRUE(
        saysOnce(world.rolvane({"group", "choose", "Family", "Bob", "Email", "Work"}), kNoSuchThing, "no member"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "choose", "Family", "Ada", "Email"}), kWrongLine, "--clear"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "choose", "Family", "Ada", "Colour", "x"}), kWrongLine, "property"));
}

TEST_F(Contacts, DefaultsAreWrittenReadAndDeleted) {
    world.done({"defaults", "write", "Number", "7", "--type", "int"});
    world.done({"defaults", "write", "Text", "7"});
    world.done({"defaults", "write", "Flag", "yes", "--type", "bool"});
    world.done({"defaults", "write", "Real", "0.5", "--type", "real"});
    world.done({"defaults", "write", "When", "2026-11-20T23:48:00Z", "--type", "date"});
    const auto all = world.json({"defaults", "read"});
    EXPECT_EQ(all["Number"], 7);
    EXPECT_EQ(all["Text"], "7");
    EXPECT_EQ(all["Flag"], true);
    EXPECT_EQ(all["Real"], 0.5);
    EXPECT_EQ(world.done({"defaults", "read", "Number"}), "7\n");
    EXPECT_TRUE(
        saysOnce(world.rolvane({"defaults", "write", "Number", "seven", "--type", "int"}), kWrongLine, "seven"));
    world.done({"defaults", "delete", "Number"});
    EXPECT_TRUE(saysOnce(world.rolvane({"defaults", "read", "Number"}), kNoSuchThing, "Number"));
    EXPECT_TRUE(saysOnce(world.rolvane({"defaults", "delete", "Number"}), kNoSuchThing, "Number"));
    world.done({"defaults", "write", "--domain", "net.example.other", "Key", "value"});
    EXPECT_EQ(world.json({"defaults", "read", "--domain", "net.example.other"}), (nlohmann::json{{"Key", "value"}}));
}

// The program under a terminal of its own, of so many columns; what it wrote there.
std::string onTerminal(CommandWorld& world, int columns, const std::string& command) {
    const Ran ran = world.run({"script", "-qec", "stty cols " + std::to_string(columns) + "; " + command, "/dev/null"});
    EXPECT_EQ(ran.status, 0) << ran;
    return ran.output;
}

TEST_F(Contacts, AListOfANarrowTerminalHasTheNameFirstThenANumberAndNoIdentifiers) {
    const std::string uid =
        world.add("Ada", {"--last", "Miller", "--phone", "mobile:+1 555 0100", "--email", "x:a@b.test"});
    world.add("Bob", {"--last", "Bartholomew-Featherstonehaugh", "--email", "home:bob@b.test"});
    const std::string out = onTerminal(world, 40, UserWorld::rolvaneProgram() + " list");
    EXPECT_TRUE(out.starts_with("Bob Bartholomew-Fea…  bob@b.test")) << out;
    EXPECT_NE(out.find("bob@b.test"), std::string::npos) << out;
    EXPECT_NE(out.find("Ada Miller            +1 555 0100"), std::string::npos) << out;
    EXPECT_EQ(out.find(uid), std::string::npos);
    EXPECT_NE(world.done({"list", "--full"}).find(uid), std::string::npos);
}

TEST_F(Contacts, NothingInANameSteersATerminal) {
    const std::string evil = "\xE2\x80\xAE"
                             "evil\x1B]0;t\x07\xC2\x9B"
                             "31m";
    world.add(evil, {"--last", "Miller", "--note", evil, "--org", evil, "--phone", "x:1"});
    world.add(evil + "2", {"--last", "Miller"});
    world.group(evil);
    const std::vector<std::vector<std::string>> commands{{"list"},
                                                         {"list", "--full"},
                                                         {"list", "--json"},
                                                         {"list", "--json", "--full"},
                                                         {"show", "Miller"},
                                                         {"duplicates"},
                                                         {"group", "list"},
                                                         {"group", "show", "evil"},
                                                         {"group", "list", "--json"},
                                                         {"delete", "Miller"}};
    size_t printed = 0;
    for (const auto& command : commands) {
        const Ran ran = world.rolvane(command);
        for (const std::string& text : {ran.output, ran.errors}) {
            printed += text.find("u202e") != std::string::npos ? 1 : 0;
            for (const char* raw : {"\x1B", "\x07", "\xE2\x80\xAE", "\xC2\x9B"})
                EXPECT_EQ(text.find(raw), std::string::npos) << command.front() << ": " << text;
        }
    }
    EXPECT_GE(printed, 7U) << "the names are shown, with escapes";
    // The database takes no control characters of the lowest kind; what it has taken is in the document.
    EXPECT_EQ(world.json({"list", "--full"})[0]["properties"]["Note"], "\xE2\x80\xAE"
                                                                       "evil]0;t\xC2\x9B"
                                                                       "31m");
}

TEST_F(Contacts, AListWithEverythingHasForEachWhatShowHas) {
    world.add("Ada", {"--last", "O\"Mill\\er", "--phone", "mobile:+1 555 0100", "--birthday", "1980-12-31"});
    world.add("Émile", {"--note", "two\nlines"});
    world.group("Family", {"Ada"});
    const auto all = world.json({"list", "--full"});
    ASSERT_EQ(all.size(), 2U);
    for (const auto& each : all) EXPECT_EQ(each, world.json({"show", each["identifier"].get<std::string>()}));
}

TEST_F(Contacts, ABirthdayWithoutItsYearIsShownAsADay) {
    world.done({"import", "-q", "-"}, "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Ada\r\nBDAY:--0517\r\nEND:VCARD\r\n");
    EXPECT_NE(world.done({"show", "Ada"}).find("17 May"), std::string::npos);
}

TEST_F(Contacts, ABirthdayIsADayInACardToo) {
    world.add("Ada", {"--birthday", "1980-12-31"});
    const Ran ran = world.rolvane({"export"});
    EXPECT_NE(ran.output.find("\nBDAY:19801231\r\n"), std::string::npos) << ran;
    EXPECT_EQ(ran.errors, "1 card written.\n");
}

TEST_F(Contacts, PeopleWhoAreOneAreListedAndJoinedAndATrialJoinsNobody) {
    const std::string one = world.add("Ada", {"--email", "home:ada@b.test", "--title", "Cook"});
    const std::string two = world.add("Ada", {"--email", "work:ada@b.test", "--title", "Baker"});
    const auto alike = world.json({"duplicates"});
    ASSERT_EQ(alike.size(), 1U);
    EXPECT_EQ(alike[0]["alike"], "same");
    EXPECT_EQ(world.json({"merge", "Ada", "--dry-run"}).size(), 1U);
    EXPECT_EQ(world.json({"list"}).size(), 2U);
    const auto told = world.json({"merge", one, two});
    EXPECT_EQ(told[0]["gaveWay"][0], "JobTitle: Baker");
    const auto left = world.json({"list", "--full"});
    ASSERT_EQ(left.size(), 1U);
    EXPECT_EQ(left[0]["identifier"], one);
    EXPECT_EQ(left[0]["properties"]["Note"], "JobTitle: Baker");
    EXPECT_EQ(world.json({"duplicates"}).size(), 0U);
    EXPECT_TRUE(saysOnce(world.rolvane({"merge", "Ada"}), kNoSuchThing, "no two people"));
    EXPECT_TRUE(saysOnce(world.rolvane({"merge"}), kWrongLine, "--alike"));
}

TEST_F(Contacts, ACharacterSetThatIsNoneIsRefused) {
    EXPECT_TRUE(saysOnce(world.rolvane({"import", "--charset", "KLINGON", "-"}), kWrongLine, "KLINGON"));
}

} // namespace
} // namespace rolvane::test
