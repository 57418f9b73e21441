#include "CommandWorld.h"

#include "support/PseudoTerminal.h"

#include <algorithm>
#include <sstream>

namespace rolvane::test {
namespace {

struct Searching : testing::Test {
    CommandWorld world;
};

TEST_F(Searching, PeopleAreFoundByWordsOfAllThatTheyHave) {
    world.add("Jürgen",
              {"--last", "Groß", "--note", "met at the Zürich fair", "--phone", "mobile:+49 (0)170 123 45 67"});
    world.add("Bob", {"--email", "work:bob@example.org"});
    EXPECT_EQ(world.done({"search", "zurich", "JURGEN", "gross"}), world.done({"list", "gross"}));
    EXPECT_EQ(lineCount(world.done({"search", "0170", "1234567"})), 1U);
    EXPECT_EQ(lineCount(world.done({"search", "+49", "170 1234567"})), 1U);
    EXPECT_EQ(world.json({"search", "example.org"})[0]["name"], "Bob");
    EXPECT_TRUE(saysOnce(world.rolvane({"search", "zurich", "bob"}), kNoSuchThing, "Nobody has \"zurich bob\""));
    EXPECT_EQ(world.json({"search", "nobody"}, kNoSuchThing), nlohmann::json::array());
    EXPECT_EQ(world.rolvane({"search"}).status, kWrongLine);
    EXPECT_TRUE(saysOnce(world.rolvane({"search", " "}), kWrongLine, "Name a word"));
}

TEST_F(Searching, AMistypedNameIsAnsweredWithNearOnes) {
    world.add("Ada", {"--last", "Miller"});
    world.add("Jürgen");
    world.group("Family");
    EXPECT_TRUE(saysOnce(world.rolvane({"show", "Ada Milelr"}), kNoSuchThing, "Did you mean \"Ada Miller\"?"));
    EXPECT_TRUE(saysOnce(world.rolvane({"show", "millr"}), kNoSuchThing, "Did you mean \"Ada Miller\"?"));
    EXPECT_TRUE(saysOnce(world.rolvane({"show", "Jurgen"}), kNoSuchThing, "Did you mean \"Jürgen\"?"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "show", "Famly"}), kNoSuchThing, "Did you mean \"Family\"?"));
    const Ran far = world.rolvane({"show", "Somebody"});
    EXPECT_TRUE(saysOnce(far, kNoSuchThing, "There is no person \"Somebody\""));
    EXPECT_EQ(far.errors.find("Did you mean"), std::string::npos);
}

TEST_F(Searching, AMistypedCommandIsAnsweredWithNearOnes) {
    EXPECT_TRUE(saysOnce(world.rolvane({"pubish"}), kWrongLine, "Did you mean \"publish\""));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "shwo"}), kWrongLine, "Did you mean \"show\"?"));
    const Ran far = world.rolvane({"xyzzy"});
    EXPECT_TRUE(saysOnce(far, kWrongLine, "There is no command \"rolvane xyzzy\""));
    EXPECT_EQ(far.errors.find("Did you mean"), std::string::npos);
}

TEST_F(Searching, ABegunCommandIsAnsweredWithTheWholeOnes) {
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "ad"}), kWrongLine, "Did you mean \"add\" or \"add-group\"?"));
    EXPECT_TRUE(saysOnce(world.rolvane({"stat"}), kWrongLine, "Did you mean \"status\"?"));
}

TEST_F(Searching, HelpTellsOfCommandsAndTopics) {
    EXPECT_EQ(world.done({"help", "group", "add"}), world.done({"group", "add", "--help"}));
    const std::string all = world.done({"help"});
    EXPECT_TRUE(all.starts_with(world.done({"--help"})));
    EXPECT_NE(all.find("exit-codes"), std::string::npos);
    const std::string codes = world.done({"help", "exit-codes"});
    EXPECT_NE(codes.find("6  the store or the daemon was not reached in time"), std::string::npos);
    EXPECT_NE(world.done({"--help"}).find(codes), std::string::npos);
    EXPECT_NE(world.done({"help", "names"}).find("identifier"), std::string::npos);
    EXPECT_TRUE(saysOnce(world.rolvane({"help", "nmaes"}), kNoSuchThing, "Did you mean \"names\"?"));
    EXPECT_TRUE(saysOnce(world.rolvane({"help", "group", "fly"}), kNoSuchThing, "\"group fly\""));
}

// What a terminal shows of one line that is drawn again and again: each drawing's length in columns.
std::vector<size_t> drawings(const std::string& shown) {
    std::vector<size_t> lengths;
    std::istringstream stream(shown);
    for (std::string piece; std::getline(stream, piece, '\r');) {
        std::string plain = piece.substr(0, piece.find('\033'));
        // Every character takes one column; those of several bytes begin with one that is no continuation.
        const auto columns = std::count_if(plain.begin(), plain.end(), [](char c) {
            return c != '\n' && (static_cast<unsigned char>(c) & 0xC0) != 0x80;
        });
        if (columns > 0) lengths.push_back(static_cast<size_t>(columns));
    }
    return lengths;
}

TEST_F(Searching, AProgressBarFitsEveryTerminal) {
    std::string cards;
    for (int i = 0; i < 1500; ++i)
        cards += "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:P" + std::to_string(i) + "\r\nN:P" + std::to_string(i) +
                 ";;;;\r\nEND:VCARD\r\n";
    const std::string file =
        world.write("a file with a name that is longer than forty columns are, and more.vcf", cards);
    world.done({"import", "-q", file});
    for (const unsigned short columns : {20, 40, 60, 80, 200}) {
        PseudoTerminal terminal({UserWorld::rolvaneProgram(), "export", "-o", world.home / "out.vcf"},
                                world.home.environment(), {.columns = columns, .rows = 24});
        const std::string shown = terminal.readToEnd();
        const std::vector<size_t> lengths = drawings(shown);
        ASSERT_GE(lengths.size(), 10U) << shown;
        EXPECT_LT(*std::max_element(lengths.begin(), lengths.end()), columns) << shown;
        EXPECT_NE(shown.find("100%"), std::string::npos) << shown;
        if (columns >= 40) {
            EXPECT_NE(shown.find("Exporting [##########"), std::string::npos) << shown;
        }
        PseudoTerminal importing({UserWorld::rolvaneProgram(), "import", file}, world.home.environment(),
                                 {.columns = columns, .rows = 24});
        for (const std::string whole = importing.readToEnd();
             const size_t length : drawings(whole.substr(0, whole.find("100%"))))
            EXPECT_LT(length, columns) << whole;
    }
}

} // namespace
} // namespace rolvane::test
