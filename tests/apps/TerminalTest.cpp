// The same commands at terminals of all widths, in pipes, without colours, and in two languages.

#include "CommandWorld.h"
#include "TerminalSession.h"

#include "support/PseudoTerminal.h"

#include <algorithm>
#include <regex>
#include <sstream>

namespace rolvane::test {
namespace {

struct Shown {
    int status = -1;
    std::string text;
};

struct Terminals : testing::Test {
    CommandWorld world;

    std::vector<std::string> environment(const std::string& language) {
        std::vector<std::string> variables = world.home.environment();
        std::erase_if(variables, [](const std::string& each) { return each.starts_with("LANG="); });
        for (const char* each : {"NO_COLOR=1", "TERM=xterm-256color"}) variables.emplace_back(each);
        variables.push_back("LANG=" + language);
        return variables;
    }
    Shown at(unsigned short columns, const std::string& language, const std::string& command) {
        PseudoTerminal terminal({"sh", "-c", UserWorld::rolvaneProgram() + " " + command + "; echo \"<ended $?>\""},
                                environment(language), {.columns = columns, .rows = 24});
        Shown shown{-1, terminal.readToEnd()};
        static const std::regex ended("<ended ([0-9]+)>");
        std::smatch found;
        if (std::regex_search(shown.text, found, ended)) shown.status = std::stoi(found[1]);
        return shown;
    }
    Ran inAPipe(const std::string& language, const std::string& command) {
        ChildProcess child({.arguments = {"sh", "-c", UserWorld::rolvaneProgram() + " " + command},
                            .environment = environment(language),
                            .input = {}});
        child.closeInput();
        const auto ending = child.wait(60);
        if (!ending) child.kill();
        return {ending ? ending->status : -1, child.output(), child.errors()};
    }
};

// Characters of ASCII count; the bar has no others.
size_t widestBar(const std::string& shown, size_t& bars) {
    size_t widest = 0;
    static const std::regex bar("[^\r\n]*\\[[# ]+\\] +[0-9]+%[^\r\n]*"), control("\x1B\\[[0-9;]*[A-Za-z]");
    for (std::sregex_iterator i(shown.begin(), shown.end(), bar), end; i != end; ++i, ++bars)
        widest = std::max(widest, std::regex_replace(i->str(), control, "").size());
    return widest;
}

TEST_F(Terminals, OfEveryWidthHaveRoomForAProgressBar) {
    const std::string import = "import " + quotedForShell(ROLVANE_SOURCE_DIR "/share/demo/people.vcf");
    bool german = false;
    for (const unsigned short columns : {40, 60, 80, 120, 200}) {
        german = !german;
        const Shown shown = at(columns, german ? "de_DE.UTF-8" : "C", import);
        EXPECT_EQ(shown.status, kDone) << columns << " columns:\n" << shown.text;
        size_t bars = 0;
        const size_t widest = widestBar(shown.text, bars);
        EXPECT_GT(bars, 0U) << columns << " columns:\n" << shown.text;
        EXPECT_LT(widest, columns) << "the last column stays free\n" << shown.text;
    }
}

TEST_F(Terminals, AndPipesHaveTheSameExitCodesAndNoColours) {
    world.add("Ada", {"--last", "Miller"});
    world.group("Family", {"Ada"});
    const std::pair<const char*, int> kCommands[] = {
        {"list", kDone},
        {"show Ada", kDone},
        {"show Nobody", kNoSuchThing},
        {"search miller", kDone},
        {"search nobody", kNoSuchThing},
        {"group list", kDone},
        {"group show Family", kDone},
        {"log", kDone},
        {"plan", kDone},
        {"status", kDone},
        {"help", kDone},
        {"help nothing", kNoSuchThing},
        {"nothing", kWrongLine},
        {"delete", kWrongLine},
        {"daemon status", kNoSuchThing},
        {"import /nowhere", kFailure},
        {"who Ada", kDone},
        {"restore /nowhere", kFailure},
        {"watch --once --seconds 0.1", kNotReached},
    };
    static const std::regex colour("\x1B\\[[0-9;]*m");
    for (const auto& [command, status] : kCommands) {
        const Ran plain = inAPipe("C", command), german = inAPipe("de_DE.UTF-8", command);
        EXPECT_EQ(plain.status, status) << command << "\n" << plain;
        EXPECT_EQ(german.status, status) << command << "\n" << german;
        EXPECT_EQ(plain.output.empty(), german.output.empty()) << command;
        EXPECT_EQ((plain.output + plain.errors + german.output + german.errors).find('\x1B'), std::string::npos)
            << command;
        for (const unsigned short columns : {40, 80, 200}) {
            const Shown shown = at(columns, "de_DE.UTF-8", command);
            EXPECT_EQ(shown.status, status) << command << " at " << columns << " columns\n" << shown.text;
            EXPECT_FALSE(std::regex_search(shown.text, colour)) << command << "\n" << shown.text;
        }
    }
}

// But for the command lines of examples, which are to be copied.
TEST_F(Terminals, OfEveryWidthHaveRoomForTheHelp) {
    for (const unsigned short columns : {40, 60, 80, 120})
        for (const char* command : {"help", "help setup", "help books on", "publish --help", "help names",
                                    "help output", "help files", "help exit-codes"})
            for (const char* language : {"C", "de_DE.UTF-8"}) {
                const Shown shown = at(columns, language, command);
                EXPECT_EQ(shown.status, kDone) << shown.text;
                std::istringstream lines(shown.text);
                for (std::string line; std::getline(lines, line);) {
                    if (line.ends_with('\r')) line.pop_back();
                    const size_t begin = std::min(line.find_first_not_of(' '), line.size());
                    const bool isCommand = line.compare(begin, 8, "rolvane ") == 0;
                    const bool isOneWord = line.find(' ', begin) == std::string::npos;
                    const auto isBegin = [](char c) { return (static_cast<unsigned char>(c) & 0xC0U) != 0x80U; };
                    const auto width = std::count_if(line.begin(), line.end(), isBegin);
                    EXPECT_TRUE(isCommand || isOneWord || width <= columns)
                        << columns << " columns, " << language << ", " << command << ":\n"
                        << line;
                }
            }
}

// Whoever has set nothing up gets one answer from all commands that need it.
TEST_F(Terminals, ShowThatThereIsNoAccountWithOneExitCode) {
    world.add("Ada");
    for (const char* command : {"account show", "account test", "publish", "unpublish", "share bob", "unshare bob",
                                "shares", "rights bob", "subscribe bob", "invite bob"})
        EXPECT_TRUE(saysOnce(inAPipe("C", command), kNoSuchThing, "There is no account on a store yet.")) << command;
}

} // namespace
} // namespace rolvane::test
