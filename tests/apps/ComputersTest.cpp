// Several computers of one person, by the commands: join, computers, leave, and what publish and unpublish refuse.

#include "Neighbour.h"

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <map>
#include <regex>
#include <sstream>

namespace rolvane::test {
namespace {

class Computers : public testing::Test {
protected:
    Computers() {
        world.bus();
        world.makeAccount();
        world.add("Ada");
        world.add("Ben");
        world.group("Friends", {"Ada"});
        world.done({"computers", "--name", "desk"});
        laptop = std::make_unique<Neighbour>(world, UserWorld::kUser,
                                             std::vector<std::string>{"--endpoint", world.store().endpointTemplate(),
                                                                      "--ca-file", world.store().caFile()});
        laptop->done({"computers", "--name", "laptop"});
    }
    ~Computers() override { laptop.reset(); }
    std::map<std::string, std::string> treeWithContents() {
        std::map<std::string, std::string> all;
        for (const std::string& path : world.tree()) all[path] = contentsOf(world.treeDirectory() + "/" + path);
        return all;
    }
    static std::string people(const nlohmann::json& listed) {
        std::vector<std::string> names;
        for (const auto& each : listed) names.push_back(each["name"].get<std::string>());
        std::sort(names.begin(), names.end());
        std::string text;
        for (const std::string& name : names) text += name + " ";
        return text;
    }
    std::string onDesk() { return people(world.json({"list"})); }
    std::string onLaptop() { return people(laptop->json({"list"})); }
    void joined() {
        world.done({"publish"});
        laptop->done({"join", "--yes"});
        world.done({"sync"});
    }
    static std::vector<std::string> namesOf(const nlohmann::json& computers) {
        std::vector<std::string> names;
        for (const auto& each : computers) names.push_back(each["name"].get<std::string>());
        std::sort(names.begin(), names.end());
        return names;
    }

    CommandWorld world;
    std::unique_ptr<Neighbour> laptop;
};

TEST_F(Computers, JoinRefusesWhereNothingIsPublishedAndMakesNothingThere) {
    EXPECT_TRUE(saysOnce(laptop->rolvane({"join", "--yes"}), kNoSuchThing, "Publish on the other computer first"));
    EXPECT_EQ(world.tree(), std::set<std::string>{});
}

TEST_F(Computers, JoinRefusesATreeWithoutItsList) {
    world.done({"publish"});
    world.done({"daemon", "stop"});
    std::filesystem::remove_all(world.published("AllCXGroup"));
    const auto before = treeWithContents();
    EXPECT_TRUE(saysOnce(laptop->rolvane({"join", "--yes"}), kNotAllowed, "no list of its contacts"));
    EXPECT_EQ(treeWithContents(), before);
    EXPECT_EQ(onLaptop(), "");
}

TEST_F(Computers, JoinRefusesATreeOfSingleGroups) {
    world.done({"publish", "--group", "Friends"});
    const auto before = treeWithContents();
    EXPECT_TRUE(saysOnce(laptop->rolvane({"join", "--yes"}), kNotAllowed, "rolvane publish"))
        << "the other one publishes";
    EXPECT_EQ(treeWithContents(), before);
    EXPECT_EQ(laptop->json({"status"})["published"]["everything"], false);
    world.group("Nobody");
    world.done({"unpublish", "--yes"});
    world.done({"publish", "--group", "Nobody"});
    EXPECT_EQ(laptop->rolvane({"join", "--yes"}).status, kNotAllowed) << "a group without members";
    world.done({"publish"});
    laptop->done({"join", "--yes"});
    EXPECT_EQ(onLaptop(), onDesk());
}

TEST_F(Computers, JoinAsksAndTriesWithoutChangingAnything) {
    world.done({"publish"});
    laptop->done({"add", "--first", "Dora"});
    const auto before = treeWithContents();
    EXPECT_TRUE(saysOnce(laptop->rolvane({"join"}), kNotAllowed, "2 people and 1 group come from the store"));
    const auto trial = laptop->json({"join", "--dry-run"});
    EXPECT_EQ(trial["peopleThere"], 2);
    EXPECT_EQ(trial["peopleHere"], 1);
    EXPECT_EQ(trial["peopleOfBoth"], 0);
    EXPECT_EQ(treeWithContents(), before);
    EXPECT_EQ(onLaptop(), "Dora ");
    EXPECT_EQ(laptop->json({"status"})["published"]["everything"], false);
}

TEST_F(Computers, JoinBringsAllOfItKeepsWhatWasHereAndBothStayInStep) {
    world.done({"publish"});
    laptop->done({"add", "--first", "Dora"});
    const auto told = laptop->json({"join", "--yes"});
    EXPECT_EQ(told["joined"], true);
    EXPECT_EQ(told["people"], 3);
    EXPECT_NE(contentsOf(told["kept"].get<std::string>()).find("Dora"), std::string::npos);
    EXPECT_EQ(onLaptop(), "Ada Ben Dora ");
    world.done({"sync"});
    EXPECT_EQ(onDesk(), "Ada Ben Dora ") << "the first computer has noticed by itself";
    world.done({"edit", "Ada", "--first", "Adelheid"});
    world.done({"sync"});
    laptop->done({"sync"});
    EXPECT_EQ(onLaptop(), "Adelheid Ben Dora ");
    laptop->done({"delete", "Ben", "--yes"});
    laptop->done({"sync"});
    world.done({"sync"});
    EXPECT_EQ(onDesk(), "Adelheid Dora ");
}

TEST_F(Computers, AreNamedWithTheMomentWhenEachWasLastThere) {
    joined();
    for (const auto& computers : {world.json({"computers"}), laptop->json({"computers"}),
                                  world.json({"status"})["computers"], laptop->json({"status"})["computers"]}) {
        EXPECT_EQ(namesOf(computers), (std::vector<std::string>{"desk", "laptop"})) << computers;
        for (const auto& each : computers) EXPECT_TRUE(each["lastThere"].is_string());
        EXPECT_EQ(
            std::count_if(computers.begin(), computers.end(), [](const auto& each) { return each["thisComputer"]; }),
            1);
    }
    EXPECT_NE(world.done({"status"}).find("laptop, last there 20"), std::string::npos);
}

TEST_F(Computers, PublishRefusesOverWhatAnotherOneHasPublishedAndNamesIt) {
    world.done({"publish"});
    laptop->done({"add", "--first", "Dora"});
    const auto before = treeWithContents();
    EXPECT_TRUE(saysOnce(laptop->rolvane({"publish"}), kNotAllowed, "from \"desk\" (last there 20"));
    EXPECT_EQ(treeWithContents(), before);
    EXPECT_EQ(laptop->json({"status"})["published"]["everything"], false);
    laptop->done({"publish", "--replace"});
    EXPECT_NE(treeWithContents(), before);
}

TEST_F(Computers, PublishGoesOnWhereThisOneHasPublishedBefore) {
    world.done({"publish"});
    world.done({"unpublish", "--keep", "--yes"});
    world.done({"publish"});
}

TEST_F(Computers, UnpublishRefusesAndNamesTheOtherOne) {
    joined();
    const auto before = treeWithContents();
    for (const bool keeps : {false, true}) {
        std::vector<std::string> line{"unpublish", "--yes"};
        if (keeps) line.emplace_back("--keep");
        EXPECT_TRUE(saysOnce(world.rolvane(line), kNotAllowed, "kept in step with \"laptop\" (last there 20"));
    }
    EXPECT_EQ(treeWithContents(), before);
}

TEST_F(Computers, AWithdrawalForAllLeavesEverythingInEachDatabase) {
    joined();
    world.done({"unpublish", "--all-computers", "--yes"});
    laptop->rolvane({"sync"});
    EXPECT_EQ(onLaptop(), "Ada Ben ");
    EXPECT_EQ(onDesk(), "Ada Ben ");
    const auto status = laptop->json({"status"});
    EXPECT_EQ(status["published"]["everything"], false);
    EXPECT_EQ(status["publicationEnded"]["why"], "withdrawnElsewhere");
    EXPECT_EQ(world.tree(), std::set<std::string>{}) << "it is not made again";
    laptop->done({"publish"});
    EXPECT_EQ(laptop->json({"status"})["published"]["everything"], true);
}

TEST_F(Computers, RightsTravel) {
    Neighbour bob(world, "bob");
    world.done({"publish"});
    world.done({"share", "bob"});
    laptop->done({"join", "--yes"});
    EXPECT_EQ(laptop->json({"shares"})[0]["rights"], "read");
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], true);
    laptop->done({"share", "bob", "--write"});
    world.done({"sync"});
    EXPECT_EQ(world.json({"shares"})[0]["rights"], "write");
    EXPECT_EQ(bob.json({"rights", "alice"})["write"], true);
    world.done({"unshare", "bob"});
    laptop->done({"sync"});
    EXPECT_EQ(laptop->json({"shares"}), nlohmann::json::array());
    EXPECT_EQ(bob.json({"rights", "alice"})["read"], false);
}

TEST_F(Computers, LeaveTouchesNeitherTreeNorDatabase) {
    joined();
    auto before = treeWithContents();
    EXPECT_TRUE(saysOnce(laptop->rolvane({"leave"}), kNotAllowed, "Nothing was changed"));
    laptop->done({"leave", "--yes"});
    auto after = treeWithContents();
    EXPECT_NE(after["computers"], before["computers"]) << "it is not listed any more";
    for (auto* tree : {&before, &after})
        for (const char* own : {"computers", "dateFile"}) tree->erase(own);
    EXPECT_EQ(after, before);
    EXPECT_EQ(onLaptop(), "Ada Ben ");
    EXPECT_EQ(namesOf(world.json({"computers"})), std::vector<std::string>{"desk"});
    laptop->done({"edit", "Ada", "--first", "Adelheid"});
    laptop->rolvane({"sync"});
    world.done({"sync"});
    EXPECT_EQ(onDesk(), "Ada Ben ");
    EXPECT_TRUE(saysOnce(laptop->rolvane({"publish"}), kNotAllowed, "from \"desk\""));
    EXPECT_TRUE(saysOnce(laptop->rolvane({"leave", "--yes"}), kNotAllowed, "in step with no other one"));
    laptop->done({"join", "--yes"});
    world.done({"sync"});
    EXPECT_EQ(onLaptop(), "Adelheid Ben ") << "an edit of what both had is merged when they meet again";
    EXPECT_EQ(onDesk(), "Adelheid Ben ");
}

TEST_F(Computers, ALostOneIsTakenOffTheListByName) {
    joined();
    laptop->done({"daemon", "stop"});
    EXPECT_TRUE(saysOnce(world.rolvane({"leave", "--computer", "tablet"}), kNoSuchThing, "No other computer"));
    world.done({"leave", "--computer", "laptop"});
    EXPECT_EQ(namesOf(world.json({"computers"})), std::vector<std::string>{"desk"});
}

// The second half of moving to a new computer, where the old one is lost.
TEST_F(Computers, ANewComputerHasEverythingAgainByJoining) {
    world.done({"publish"});
    world.done({"daemon", "stop"});
    laptop->done({"join", "--yes"});
    EXPECT_EQ(onLaptop(), "Ada Ben ");
    EXPECT_EQ(laptop->json({"group", "list"})[0]["name"], "Friends");
    laptop->done({"leave", "--computer", "desk"});
    laptop->done({"edit", "Ada", "--first", "Adelheid"});
    laptop->done({"sync"});
    EXPECT_EQ(laptop->json({"status"})["pending"], 0);
}

// The commands of docs/computers.md, but for the account, which both have.
TEST_F(Computers, AnotherOneIsInvitedByALineThatHoldsThePassword) {
    world.done({"publish"});
    const Ran ran = world.rolvane({"computers", "--invite"});
    ASSERT_EQ(ran.status, kDone) << ran;
    EXPECT_EQ(lineCount(ran.output), 1U) << ran;
    EXPECT_TRUE(ran.output.starts_with("rolvane:1:")) << ran;
    EXPECT_NE(ran.errors.find("The line holds your password"), std::string::npos) << ran;
    EXPECT_NE(ran.errors.find("rolvane join"), std::string::npos) << ran;
    EXPECT_GT(lineCount(world.done({"computers", "--invite", "--qr"})), 10U);
    const auto told = world.json({"computers", "--invite"});
    EXPECT_EQ(told["holdsPassword"], true);
    EXPECT_EQ(told["invitation"].get<std::string>() + "\n", ran.output);
    Neighbour third(world, UserWorld::kUser, Neighbour::NothingYet{});
    third.done({"setup", told["invitation"], "--no-input"});
    third.done({"join", "--yes"});
    EXPECT_EQ(people(third.json({"list"})), onDesk());
    EXPECT_EQ(third.json({"subscriptions"}), nlohmann::json::array()) << "nobody subscribes to oneself";
    world.done({"sync"});
    EXPECT_EQ(world.rolvane({"computers", "--qr"}).status, kWrongLine);
    EXPECT_EQ(world.rolvane({"computers", "--invite", "--name", "x"}).status, kWrongLine);
}

TEST_F(Computers, AnotherOneIsInvitedByNobodyWithoutAnAccountOrAStore) {
    Neighbour fresh(world, "fresh", Neighbour::NothingYet{});
    EXPECT_EQ(fresh.rolvane({"computers", "--invite"}).status, kNoSuchThing);
    world.done({"publish"});
    world.store().stop(PrivateStore::Stop::atOnce);
    const Ran ran = world.rolvane({"computers", "--invite"});
    EXPECT_EQ(ran.status, kNotReached) << ran;
    EXPECT_EQ(ran.output, "") << "the password goes nowhere";
}

TEST_F(Computers, AreLedByAPageThatDoesWhatItSays) {
    const std::string page = contentsOf(ROLVANE_SOURCE_DIR "/docs/computers.md");
    const std::regex prompt("\n    (first|second)\\$ rolvane ([^\n]*)");
    size_t commands = 0;
    for (std::sregex_iterator i(page.begin(), page.end(), prompt), end; i != end; ++i, ++commands) {
        std::istringstream words((*i)[2]);
        std::vector<std::string> line{std::istream_iterator<std::string>(words), {}};
        if (line.front() == "setup") continue;
        const Ran ran = (*i)[1] == "first" ? world.rolvane(line) : laptop->rolvane(line);
        EXPECT_EQ(ran.status, kDone) << (*i)[0] << "\n" << ran;
    }
    EXPECT_GT(commands, 6U);
    EXPECT_EQ(onLaptop(), "Ada Ben ");
}

TEST_F(Computers, OwnSubscriptionsAreToldToJoin) {
    EXPECT_TRUE(saysOnce(laptop->rolvane({"subscribe", "alice"}), kNotAllowed, "rolvane join"));
}

} // namespace
} // namespace rolvane::test
