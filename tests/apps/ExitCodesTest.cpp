// Every command in every situation that has an exit code of its own (`rolvane help exit-codes`): without an account,
// with a store that is away, with one that refuses the password, with a wrong line, and with a name that nobody has. In
// pipes, at terminals of all widths, in three languages.

#include "CommandWorld.h"
#include "TerminalSession.h"

#include "support/PseudoTerminal.h"

#include <array>
#include <filesystem>
#include <regex>
#include <set>
#include <sstream>

namespace rolvane::test {
namespace {

constexpr int kNotRun = -1; // its own tests have it: it serves, or it is about another server
// The exit codes of `line` without an account, with a store that is away, and with one that refuses. `stranger` names
// nobody in the place of somebody, and ends with 3.
struct Row {
    const char* line;
    int none, away, refused;
    const char* stranger = "";
};

// The first two words are the command, as far as it has two. Commands that need no store end alike in all situations.
const std::vector<Row> kRows{
    // What is here.
    {"list", 0, 0, 0, "list --of nobody"},
    {"list --of nobody", 3, 3, 3},
    {"search Ada", 0, 0, 0, "search nobody"},
    {"show Ada", 0, 0, 0, "show Nobody"},
    {"add --first Eve", 0, 0, 0},
    {"edit Ada --note word", 0, 0, 0, "edit Nobody --note word"},
    {"duplicates", 0, 0, 0},
    {"merge Ada Bert --dry-run", 0, 0, 0, "merge Ada Nobody"},
    {"export Ada", 0, 0, 0, "export Nobody"},
    {"import CARDS", 0, 0, 0},
    {"import /nowhere", 1, 1, 1},
    {"group list", 0, 0, 0},
    {"group create Chess", 0, 0, 0, "group create Go Nobody"},
    {"group show Family", 0, 0, 0, "group show Strangers"},
    {"group rename Chess Draughts", 0, 0, 0, "group rename Strangers Friends"},
    {"group add Family Bert", 0, 0, 0, "group add Family Nobody"},
    {"group remove Family Bert", 0, 0, 0, "group remove Family Nobody"},
    {"group add-group Family Draughts", 0, 0, 0, "group add-group Family Strangers"},
    {"group remove-group Family Draughts", 0, 0, 0, "group remove-group Family Strangers"},
    {"group choose Family Ada Email --clear", 0, 0, 0, "group choose Family Nobody Email --clear"},
    {"group delete Draughts --yes", 0, 0, 0, "group delete Strangers --yes"},
    {"group delete Family", 5, 5, 5},
    {"delete Bert", 5, 5, 5, "delete Nobody --yes"},
    {"delete Bert --yes", 0, 0, 0},
    {"who Ada", 0, 0, 0, "who Nobody"},
    {"log", 0, 0, 0, "log Nobody"},
    {"undo 999999", 3, 3, 3},
    {"plan", 0, 0, 0},
    {"conflicts list", 0, 0, 0},
    {"conflicts restore 7", 3, 3, 3},
    {"conflicts forget 7", 3, 3, 3},
    {"withdrawn list", 0, 0, 0},
    {"withdrawn import nobody", 3, 3, 3},
    {"withdrawn forget nobody --yes", 3, 3, 3},
    {"subscriptions", 0, 0, 0},
    {"defaults read", 0, 0, 0, "defaults read NoSuchKey"},
    {"defaults write Key word", 0, 0, 0},
    {"defaults delete Key", 0, 0, 0, "defaults delete NoSuchKey"},
    {"backup FILE", 0, 0, 0},
    {"restore /nowhere", 1, 1, 1},
    {"status", 0, 0, 0},
    {"help", 0, 0, 0, "help nothing"},
    {"store status", 3, 3, 3},
    {"store stop", 0, 0, 0},
    {"store reload", 3, 3, 3},
    {"store backup /nowhere/store.tar.gz", 1, 1, 1},
    {"store restore /nowhere/store.tar.gz --yes", 1, 1, 1},
    {"store user quota", 0, 0, 0},
    {"store user list", 0, 0, 0},
    {"store user add carl", 2, 2, 2},
    {"store user remove carl --yes", 3, 3, 3},
    {"store start", kNotRun, kNotRun, kNotRun},
    {"books status", 3, 3, 3},
    {"books off", 0, 0, 0},
    {"books on", kNotRun, kNotRun, kNotRun},
    {"books devices", 0, 0, 0},
    {"books device add", kNotRun, kNotRun, kNotRun},
    {"books device remove laptop", 3, 3, 3},
    {"books link https://localhost:1/", 1, 1, 1},
    {"books unlink", 3, 3, 3},
    {"books sync", 3, 3, 3},
    {"daemon status", 3, 3, 3},
    {"daemon stop", 0, 0, 0},
    {"daemon start", kNotRun, kNotRun, kNotRun},
    {"daemon restart", kNotRun, kNotRun, kNotRun},
    {"watch --once --seconds 0.1", 6, 6, 6},
    // What is on a store. Everything is published where there is one, and then it goes away, or refuses.
    {"account show", 3, 0, 0},
    {"account test", 3, 6, 5},
    {"account set --user alice", 2, 0, 0},
    {"setup --no-input", 2, 2, 2},
    {"invite bob", 3, 6, 5},
    {"doctor", 0, 1, 1},
    {"publish", 3, 6, 5, "publish --group Strangers"},
    {"share bob", 3, 6, 5},
    {"unshare bob", 3, 3, 3},
    {"shares", 3, 0, 0},
    {"rights bob", 3, 6, 5},
    {"subscribe bob", 3, 6, 5},
    {"unsubscribe bob --yes", 3, 3, 3},
    {"preview bob", 3, 3, 3},
    {"sync", 0, 6, 5}, // there is nothing to be sent where nothing is shared
    {"join --yes", 3, 6, 5},
    {"computers", 3, 0, 0},
    {"leave --yes", 3, 5, 5},
    {"unpublish --yes", 3, 6, 5},
    {"new-database --yes", 1, 1, 1},
};

std::vector<std::string> words(const std::string& line) {
    std::istringstream stream(line);
    return {std::istream_iterator<std::string>(stream), {}};
}

class ExitCodes : public testing::Test {
protected:
    ExitCodes() {
        for (const char* name : {"Ada", "Bert"}) world.add(name);
        world.group("Family", {"Ada"});
        world.write("cards.vcf", "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:Dora\r\nN:;Dora;;;\r\nEND:VCARD\r\n");
    }
    std::string inPlace(const std::string& word) {
        return word == "CARDS" ? world.home / "cards.vcf" : word == "FILE" ? world.home / "backup.rolvane" : word;
    }
    int run(const std::string& line, Ran& ran) {
        std::vector<std::string> arguments = words(line);
        for (std::string& word : arguments) word = inPlace(word);
        ran = world.rolvane(arguments);
        return ran.status;
    }
    void expectAll(int Row::*situation, const char* described) {
        for (const Row& row : kRows) {
            if (row.*situation == kNotRun) continue;
            Ran ran;
            EXPECT_EQ(run(row.line, ran), row.*situation) << described << ": rolvane " << row.line << "\n" << ran;
            if (ran.status != kDone && ran.status != row.none) {
                EXPECT_NE(ran.output + ran.errors, "") << "an exit code without a word: rolvane " << row.line;
            }
        }
    }
    void publishAndRest() {
        world.makeAccount();
        world.done({"publish"});
        world.done({"daemon", "stop"});
    }
    CommandWorld world;
};

TEST_F(ExitCodes, AreTheSameForEveryCommandWithoutAnAccount) {
    expectAll(&Row::none, "no account");
}

// A terminal, or a pipe (0 columns), in a language, with or without the wish for no colours.
struct Place {
    unsigned short columns;
    const char* language;
    bool noColour;
};

class Places : public ExitCodes, public testing::WithParamInterface<Place> {};

INSTANTIATE_TEST_SUITE_P(ExitCodes, Places,
                         testing::Values(Place{0, "C", true}, Place{0, "de_DE.UTF-8", false}, Place{40, "C", true},
                                         Place{40, "de_DE.UTF-8", true}, Place{60, "de_DE.UTF-8", false},
                                         Place{80, "C", false}, Place{80, "de_DE.UTF-8", true}, Place{120, "C", true},
                                         Place{200, "de_DE.UTF-8", true}),
                         [](const auto& each) {
                             return std::to_string(each.param.columns) +
                                    (*each.param.language == 'C' ? "C" : "German") +
                                    (each.param.noColour ? "NoColour" : "");
                         });

// With nobody who answers questions: what asks is refused. Lines of a terminal are never wider than it where a command
// draws them itself: bars, lists.
TEST_P(Places, HaveOneExitCodeForEachCommand) {
    const Place& place = GetParam();
    std::vector<std::string> environment = world.home.environment();
    std::erase_if(environment, [](const std::string& each) { return each.starts_with("LANG="); });
    environment.emplace_back("TERM=xterm-256color");
    environment.emplace_back(std::string("LANG=") + place.language);
    if (place.noColour) environment.emplace_back("NO_COLOR=1");
    static const std::regex ended("<ended ([0-9]+)>"), colour("\x1B\\[[0-9;]*m");
    for (const Row& row : kRows) {
        if (row.none == kNotRun) continue;
        std::string command = UserWorld::rolvaneProgram();
        for (const std::string& word : words(row.line)) command += " " + quotedForShell(inPlace(word));
        const std::string pipe = place.columns == 0 ? " 2>&1 | cat" : "";
        PseudoTerminal terminal({"bash", "-c", command + " </dev/null" + pipe + "; echo \"<ended ${PIPESTATUS[0]}>\""},
                                environment, {.columns = place.columns, .rows = 24});
        const std::string shown = terminal.readToEnd();
        std::smatch found;
        ASSERT_TRUE(std::regex_search(shown, found, ended)) << row.line << ":\n" << shown;
        EXPECT_EQ(std::stoi(found[1]), row.none) << "rolvane " << row.line << "\n" << shown;
        const bool mayHaveColours = place.columns > 0 && !place.noColour;
        EXPECT_TRUE(mayHaveColours || !std::regex_search(shown, colour)) << row.line << "\n" << shown;
        EXPECT_TRUE(place.columns > 0 || shown.find('\x1B') == std::string::npos) << row.line << "\n" << shown;
    }
}

TEST_F(ExitCodes, AreTheSameForEveryCommandWhenTheStoreIsAway) {
    publishAndRest();
    world.store().stop(PrivateStore::Stop::atOnce);
    expectAll(&Row::away, "the store is away");
}

TEST_F(ExitCodes, AreTheSameForEveryCommandWhenTheStoreRefuses) {
    publishAndRest();
    world.done({"account", "set", "--password-command", "echo another word"});
    expectAll(&Row::refused, "the store refuses");
}

TEST_F(ExitCodes, AreTheSameForEveryCommandWithANameThatNobodyHas) {
    for (const Row& row : kRows) {
        Ran ran;
        if (*row.stranger) {
            EXPECT_EQ(run(row.stranger, ran), kNoSuchThing) << "rolvane " << row.stranger << "\n" << ran;
        }
    }
}

// The German catalog with marks around each text, for a copy of the programs: what stands outside the marks is in no
// catalog.
class MarkedWords : public ExitCodes {
protected:
    MarkedWords() {
        namespace fs = std::filesystem;
        const std::string catalogs = world.home / "marked/share/locale/de/LC_MESSAGES";
        fs::create_directories(catalogs);
        fs::create_directories(world.home / "marked/bin");
        for (const std::string& program : {UserWorld::rolvaneProgram(), UserWorld::managerProgram()})
            fs::copy_file(program, world.home / "marked/bin" / fs::path(program).filename());
        const Ran made = world.run({"sh", "-c",
                                    "msgfilter --keep-header -i \"$1\" sed -z 's/^\\n*/&‹/; s/\\n*$/›&/' 2>/dev/null | "
                                    "msgfmt -o \"$2/rolvane.mo\" -",
                                    "sh", ROLVANE_SOURCE_DIR "/po/de.po", catalogs});
        EXPECT_EQ(made.status, 0) << made;
        world.home.setVariable("LANG", "de_DE.UTF-8");
    }
    // The text without what stands between marks, which may stand within one another.
    static std::string outside(const std::string& text) {
        static const std::string kBegin = "‹", kEnd = "›";
        std::string found;
        size_t depth = 0;
        for (size_t i = 0; i < text.size(); ++i) {
            const bool begins = text.compare(i, kBegin.size(), kBegin) == 0;
            const bool ends = depth > 0 && text.compare(i, kEnd.size(), kEnd) == 0;
            if (begins || ends) {
                depth += begins ? 1 : -1;
                i += kBegin.size() - 1;
            } else if (depth == 0) {
                found += text[i];
            }
        }
        return found;
    }
    // Three words in a row, but for command lines.
    void expectOnlyMarked(const std::string& line) {
        std::vector<std::string> command{world.home / "marked/bin/rolvane"};
        for (const std::string& word : words(line)) command.push_back(inPlace(word));
        const Ran ran = world.run(command);
        static const std::regex prose("[A-Za-z']{2,}[,;:.]? [A-Za-z']{2,}[,;:.]? [a-z']{2,}");
        std::istringstream lines(outside(ran.output + "\n" + ran.errors));
        for (std::string told; std::getline(lines, told);) {
            if (told.starts_with("rolvane: ")) told.erase(0, 9);
            const bool isKnown =
                std::any_of(std::begin(kInTheirOwnWords), std::end(kInTheirOwnWords),
                            [&](const char* each) { return std::regex_search(told, std::regex(each)); });
            EXPECT_TRUE(isKnown || !std::regex_search(told, prose)) << "rolvane " << line << "\n" << told;
        }
    }
    // Command lines, data, the library of the command line, and reasons that the rooms below give.
    static constexpr const char* kInTheirOwnWords[] = {
        "^:? *`?rolvane ",
        "^ +--",            // the second line of an example
        "cannot be read: ", // a card's file
        "^The endpoint \"", // an account that cannot be
        "^There is a contact database in ",
        "^There is no store in ",
        "^A store that root runs is restored by hand",
        "No secure connection to ",
    };
};

TEST_F(MarkedWords, AreAllThatACommandSays) {
    for (const Row& row : kRows) {
        if (row.none == kNotRun) continue;
        expectOnlyMarked(row.line);
        if (*row.stranger) expectOnlyMarked(row.stranger);
    }
}

TEST_F(MarkedWords, AreAllThatACommandSaysWithAStore) {
    publishAndRest();
    world.store().addUser("bob", "a long and other word");
    for (const char* line : {"publish", "share bob", "shares", "share bob --write", "preview bob", "who Ada", "plan",
                             "status", "sync", "doctor", "account test", "account show", "computers", "unshare bob"})
        expectOnlyMarked(line);
    world.done({"daemon", "stop"});
    world.store().stop(PrivateStore::Stop::atOnce);
    for (const Row& row : kRows)
        if (row.none != kNotRun) expectOnlyMarked(row.line);
}

TEST_F(MarkedWords, AreAllThatTheHelpSays) {
    std::set<std::string> seen;
    for (const Row& row : kRows) {
        std::string command;
        for (const std::string& word : words(row.line)) {
            if (word.starts_with('-') || word.find_first_of("ABCDEFGHIJKLMNOPQRSTUVWXYZ/") != std::string::npos) break;
            command += (command.empty() ? "" : " ") + word;
            if (command == "help") break;
            const Ran ran = world.run({world.home / "marked/bin/rolvane", "help", command});
            if (ran.status == kDone || seen.insert(command).second) expectOnlyMarked("help " + command);
        }
    }
    for (const char* topic : {"", "names", "output", "files", "exit-codes"})
        expectOnlyMarked(std::string("help ") + topic);
}

// A command that is new has to be told here how it ends.
TEST_F(ExitCodes, AreTheSameForEveryCommandWithAWrongLineAndNoCommandIsForgotten) {
    std::set<std::string> expected;
    for (const Row& row : kRows) {
        std::string command;
        for (const std::string& word : words(row.line)) expected.insert(command += (command.empty() ? "" : " ") + word);
    }
    std::vector<std::string> commands{""};
    size_t innermost = 0;
    for (size_t i = 0; i < commands.size(); ++i) {
        const std::string command = commands[i]; // the list grows
        const std::string help = world.done(words(command + " --help"));
        const size_t begin = help.find("Subcommands:\n");
        if (begin == std::string::npos) {
            ++innermost;
            EXPECT_TRUE(expected.contains(command)) << "rolvane " << command << " has no row in this test";
            EXPECT_TRUE(
                saysOnce(world.rolvane(words(command + " --no-such-option")), kWrongLine, "`rolvane " + command));
            continue;
        }
        std::istringstream lines(help.substr(begin + 13));
        for (std::string line; std::getline(lines, line) && line.starts_with("  ");)
            commands.push_back(command + (command.empty() ? "" : " ") + words(line).front());
    }
    EXPECT_GT(innermost, 70U);
}

} // namespace
} // namespace rolvane::test
