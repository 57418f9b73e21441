#include "Neighbour.h"

#include "support/PseudoTerminal.h"

#include <algorithm>
#include <set>
#include <sstream>

namespace rolvane::test {
namespace {

using Names = std::set<std::string>;
using Words = std::vector<std::string>;

std::vector<std::string> linesOf(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) {
        while (line.ends_with('\r')) line.pop_back();
        lines.push_back(line);
    }
    return lines;
}

class Completion : public testing::Test {
protected:
    // What the program tells a shell that takes words as they are.
    struct Answer {
        std::string kind;
        Names offers;
    };
    Answer answer(Words words, const std::string& program = "rolvane") {
        words.insert(words.begin(), {"complete", "zsh", program});
        const std::vector<std::string> lines = linesOf(world.done(words));
        Answer answer;
        for (const std::string& line : lines)
            if (answer.kind.empty())
                answer.kind = line;
            else
                answer.offers.insert(line.substr(0, line.find('\t')));
        return answer;
    }
    Names offered(const Words& words) {
        const Answer given = answer(words);
        EXPECT_EQ(given.kind, "offers");
        return given.offers;
    }

    struct Help {
        Names commands, options;
    };
    Help help(std::vector<std::string> command) {
        command.push_back("--help");
        Help all;
        bool listing = false;
        for (const std::string& line : linesOf(world.done(command))) {
            if (!line.starts_with(' ')) listing = line == "Subcommands:";
            const size_t begin = line.find_first_not_of(' ');
            if (begin == std::string::npos || begin == 0 || begin > 4) continue;
            const std::string word = line.substr(begin, line.find(' ', begin) - begin);
            if (listing && begin == 2) all.commands.insert(word);
            if (!word.starts_with('-')) continue;
            std::istringstream names(word);
            for (std::string name; std::getline(names, name, ',');) all.options.insert(name.substr(0, name.find('{')));
        }
        return all;
    }
    void checkFrom(const Words& command) {
        const Help told = help(command);
        auto line = command;
        line.push_back("");
        if (!told.commands.empty()) {
            EXPECT_EQ(offered(line), told.commands);
        }
        line.back() = "-";
        EXPECT_EQ(offered(line), told.options);
        for (const std::string& below : told.commands) {
            line.back() = below;
            checkFrom(line);
        }
    }
    // People, groups and a store with names that a shell would misread.
    void makeContacts() {
        world.add("Ada", {"--last", "Miller"});
        world.add("Bob");
        world.add("Q$HOME `x` \"y\" 'z'");
        world.group("Family & Friends", {"Bob"});
        world.group("Work: all; now");
        world.write("friends.vcf", "");
    }
    std::vector<std::string> environment(const std::vector<std::string>& more) {
        std::vector<std::string> all = world.home.environment();
        std::erase_if(all, [](const std::string& v) { return v.starts_with("PATH=") || v.starts_with("TERM="); });
        const std::string directory = UserWorld::rolvaneProgram().substr(0, UserWorld::rolvaneProgram().rfind('/'));
        all.push_back("PATH=" + directory + ":/usr/bin:/bin");
        all.insert(all.end(), more.begin(), more.end());
        return all;
    }
    CommandWorld world;
};

// A shell at which somebody types. It has a command `args` that prints each of its arguments on a line of its own.
class Shell {
public:
    Shell(std::vector<std::string> command, std::vector<std::string> environment)
        : _terminal(std::move(command), std::move(environment), {.columns = 400, .rows = 200}) {
        EXPECT_NE(_terminal.readUntil("READY> "), "") << _terminal.readToEnd(0);
    }
    // The arguments that the line has when its end was completed.
    Words completed(const std::string& line) {
        _terminal.type(line + "\t\001args \n");
        const std::string shown = _terminal.readUntil("<end>\r\n");
        EXPECT_NE(shown, "") << line;
        _terminal.readUntil("READY> ");
        Words all;
        for (const std::string& each : linesOf(shown))
            if (each.starts_with("<arg:") && each.ends_with(">")) all.push_back(each.substr(5, each.size() - 6));
        return all;
    }
    // What is listed where several things fit.
    Names listed(const std::string& line) {
        _terminal.type(line + "\t\001\013args\n");
        const std::string shown = _terminal.readUntil("<end>\r\n");
        EXPECT_NE(shown, "") << line;
        _terminal.readUntil("READY> ");
        Names all;
        const std::vector<std::string> lines = linesOf(shown);
        for (size_t i = 1; i < lines.size() && lines[i].find("READY> ") == std::string::npos; ++i) {
            const std::string text = lines[i].substr(0, lines[i].find("  -- "));
            all.insert(text.substr(0, text.find_last_not_of(' ') + 1));
        }
        return all;
    }

private:
    PseudoTerminal _terminal;
};

constexpr const char* kArgs = "args() { [ $# = 0 ] || printf '<arg:%s>\\n' \"$@\"; echo '<en''d>'; }\n";

// A shell that lists names as they are written shows them `escaped`.
void checkShell(Shell& shell, const std::string& home, bool escaped) {
    EXPECT_EQ(shell.completed("rolvane unpub"), (Words{"rolvane", "unpublish"}));
    EXPECT_EQ(shell.completed("rolvane group add-g"), (Words{"rolvane", "group", "add-group"}));
    EXPECT_EQ(shell.completed("rolvane --json withdr"), (Words{"rolvane", "--json", "withdrawn"}));
    EXPECT_EQ(shell.completed("rolvane publish --gr"), (Words{"rolvane", "publish", "--group"}));
    EXPECT_EQ(shell.completed("rolvane show ada"), (Words{"rolvane", "show", "Ada Miller"})) << "whatever its case";
    EXPECT_EQ(shell.completed("rolvane show Ada\\ M"), (Words{"rolvane", "show", "Ada Miller"}));
    EXPECT_EQ(shell.completed("rolvane show 'Ada M"), (Words{"rolvane", "show", "Ada Miller"}));
    EXPECT_EQ(shell.completed("rolvane show \"Ada M"), (Words{"rolvane", "show", "Ada Miller"}));
    EXPECT_EQ(shell.completed("rolvane show Q"), (Words{"rolvane", "show", "Q$HOME `x` \"y\" 'z'"}));
    EXPECT_EQ(shell.completed("rolvane show \"Q"), (Words{"rolvane", "show", "Q$HOME `x` \"y\" 'z'"}));
    EXPECT_EQ(shell.completed("rolvane publish --group fam"),
              (Words{"rolvane", "publish", "--group", "Family & Friends"}));
    EXPECT_EQ(shell.completed("rolvane publish --group=Fam"),
              (Words{"rolvane", "publish", "--group=Family & Friends"}));
    EXPECT_EQ(shell.completed("rolvane group add 'Work: all; now' B"),
              (Words{"rolvane", "group", "add", "Work: all; now", "Bob"}));
    EXPECT_EQ(shell.completed("rolvane group show Work:"), (Words{"rolvane", "group", "show", "Work: all; now"}));
    EXPECT_EQ(shell.completed("rolvane import " + home + "/fri"), (Words{"rolvane", "import", home + "/friends.vcf"}));
    EXPECT_EQ(shell.completed("RolvaneManager -"), (Words{"RolvaneManager", "-p"}));
    EXPECT_EQ(shell.listed("rolvane group re"), (Names{"remove", "remove-group", "rename"}));
    EXPECT_EQ(shell.listed("rolvane export --vcard "), (Names{"3", "4"}));
    EXPECT_EQ(shell.listed("rolvane group show "), escaped ? (Names{"Family\\ \\&\\ Friends", "Work:\\ all\\;\\ now"})
                                                           : (Names{"Family & Friends", "Work: all; now"}));
}

TEST_F(Completion, EveryCommandAndOptionThatTheHelpListsIsOffered) {
    ASSERT_GE(help({}).commands.size(), 15U);
    checkFrom({});
}

TEST_F(Completion, OnlyWhatBeginsWithTheWordIsOffered) {
    EXPECT_EQ(offered({"pub"}), Names{"publish"});
    EXPECT_EQ(offered({"export", "--gr"}), Names{"--group"});
    EXPECT_EQ(offered({"no-such-command", ""}), Names{});
    EXPECT_EQ(offered({"books", "merge"}), Names{}) << "a command that is not shown";
    EXPECT_EQ(offered({"comple"}), Names{});
}

TEST_F(Completion, NothingIsMadeAndNothingIsSaidWhereThereIsNothing) {
    for (const char* command : {"show", "subscribe", "unshare", "unsubscribe"})
        EXPECT_EQ(offered({command, ""}), Names{}) << command;
    EXPECT_EQ(offered({"publish", "--group", ""}), Names{});
    EXPECT_EQ(offered({"books", "device", "remove", ""}), Names{});
    EXPECT_EQ(offered({"conflicts", "restore", ""}), Names{});
    const Ran found = world.run({"find", world.home.path(), "-type", "f"});
    EXPECT_EQ(found.output, "");
}

TEST_F(Completion, TheValuesOfAnArgumentAreOffered) {
    makeContacts();
    EXPECT_EQ(offered({"group", "choose", "Work: all; now", "Bob", "E"}), Names{"Email"});
    EXPECT_EQ(offered({"group", "create", "New", "Bo"}), Names{"Bob"});
    EXPECT_EQ(offered({"group", "create", "New", "--", "Bo"}), Names{"Bob"});
    EXPECT_EQ(offered({"store", "start", "--authentication", ""}), (Names{"basic", "digest", "none"}));
    EXPECT_EQ(offered({"store", "start", "--authentication=d"}), (Names{"--authentication=digest"}));
    EXPECT_EQ(offered({"account", "set", "--user", ""}), Names{}) << "nobody knows it";
    EXPECT_EQ(answer({"import", ""}).kind, "files");
    EXPECT_EQ(answer({"account", "set", "--ca-file", ""}).kind, "files");
    EXPECT_EQ(answer({"store", "start", "--directory", ""}).kind, "directories");
    world.done({"defaults", "write", "CXDDebugLevel", "1", "--type", "int"});
    EXPECT_EQ(offered({"defaults", "read", "CXDD"}), Names{"CXDDebugLevel"});
    world.done({"defaults", "write", "mine", "1", "--domain", "org.example"});
    EXPECT_EQ(offered({"defaults", "delete", "--domain", "org.example", ""}), Names{"mine"});
}

TEST_F(Completion, UsersOfTheStoreAreOffered) {
    world.makeAccount();
    Neighbour bob(world, "bob");
    const std::string directory = world.home / "store"; // where the test has its store
    EXPECT_EQ(offered({"store", "user", "remove", "--directory", directory, ""}), (Names{"alice", "bob"}));
    EXPECT_EQ(offered({"store", "user", "remove", "--directory=" + directory, "b"}), Names{"bob"});
    EXPECT_EQ(offered({"unshare", ""}), Names{}) << "nobody may read yet";
    world.add("Ada");
    world.done({"publish"});
    world.done({"share", "bob"});
    EXPECT_EQ(offered({"unshare", ""}), Names{"bob"});
    EXPECT_EQ(offered({"preview", ""}), Names{"bob"});
    EXPECT_EQ(offered({"share", "b"}), Names{"bob"});
    bob.done({"subscribe", "alice"});
    const auto offeredToBob = [&](Words words) {
        words.insert(words.begin(), {"complete", "zsh", "rolvane"});
        return bob.done(words);
    };
    EXPECT_EQ(offeredToBob({"unsubscribe", ""}), "offers\nalice\tyou subscribe to\n");
    EXPECT_EQ(offeredToBob({"show", ""}), "offers\nAda\t[alice]\n");
}

TEST_F(Completion, ANameThatWouldSteerATerminalIsNotOffered) {
    world.add("Eve \u202E nair"); // turns the direction of writing
    world.add("Eva");
    EXPECT_EQ(offered({"show", "Ev"}), Names{"Eva"});
}

TEST_F(Completion, OfManyPeopleTheFirstAndTheLastAreOffered) {
    std::string cards;
    for (int i = 1000; i < 2000; ++i) {
        const std::string name = "Person " + std::to_string(i);
        cards += "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:" + name + "\r\nN:" + name + ";;;;\r\nEND:VCARD\r\n";
    }
    world.done({"import", "-q", world.write("many.vcf", cards)});
    const Names all = offered({"show", "p"});
    EXPECT_EQ(all.size(), 200U);
    EXPECT_TRUE(all.contains("Person 1000"));
    EXPECT_TRUE(all.contains("Person 1999")) << "so that no shell takes more for common than is";
    EXPECT_EQ(offered({"show", "person 155"}).size(), 10U);
}

TEST_F(Completion, WhatIsNoQuestionOfAShellIsRefused) {
    EXPECT_TRUE(saysOnce(world.rolvane({"complete"}), kWrongLine, "completion files"));
    EXPECT_TRUE(saysOnce(world.rolvane({"complete", "tcsh", "rolvane", ""}), kWrongLine, "completion files"));
}

TEST_F(Completion, BashCompletesInATerminal) {
    makeContacts();
    const std::string rc = world.write("bashrc", std::string(kArgs) + "PS1='READY> '\nsource '" ROLVANE_SOURCE_DIR
                                                                      "/packaging/completions/rolvane'\n");
    const std::string input = world.write("inputrc", "set show-all-if-ambiguous on\nset page-completions off\n"
                                                     "set completion-query-items 0\nset completion-display-width 0\n"
                                                     "set enable-bracketed-paste off\nset bell-style none\n");
    Shell shell({"bash", "--noprofile", "--rcfile", rc, "-i"}, environment({"TERM=dumb", "INPUTRC=" + input}));
    checkShell(shell, world.home.path(), true);
}

TEST_F(Completion, ZshCompletesInATerminal) {
    makeContacts();
    world.write(".zshrc", std::string(kArgs) +
                              "unsetopt prompt_cr prompt_sp always_last_prompt beep global_rcs\nbindkey -e\n"
                              "LISTMAX=10000\nfpath=('" ROLVANE_SOURCE_DIR "/packaging/completions' $fpath)\n"
                              "autoload -Uz compinit\ncompinit -u -D\nPS1='READY> '\n");
    Shell shell({"zsh", "-d", "-i"}, environment({"TERM=dumb", "ZDOTDIR=" + world.home.path()}));
    checkShell(shell, world.home.path(), false);
}

// Fish says by itself what it would offer.
TEST_F(Completion, FishCompletes) {
    makeContacts();
    const auto offers = [&](const std::string& line) {
        const Ran ran = world.run(
            {"env", "PATH=" + environment({}).back().substr(5), "fish", "--no-config", "-c",
             "source '" ROLVANE_SOURCE_DIR "/packaging/completions/rolvane.fish'; complete -C $argv[1]", line});
        EXPECT_EQ(ran.status, 0) << ran;
        EXPECT_EQ(ran.errors, "") << line;
        Names all;
        for (const std::string& each : linesOf(ran.output)) all.insert(each.substr(0, each.find('\t')));
        return all;
    };
    EXPECT_EQ(offers("rolvane unpub"), Names{"unpublish"});
    EXPECT_EQ(offers("rolvane group re"), (Names{"remove", "remove-group", "rename"}));
    EXPECT_EQ(offers("rolvane --json withdr"), Names{"withdrawn"});
    EXPECT_EQ(offers("rolvane publish --gr"), Names{"--group"});
    EXPECT_EQ(offers("rolvane show Ada"), Names{"Ada Miller"});
    EXPECT_EQ(offers("rolvane show ada"), Names{"Ada Miller"});
    EXPECT_EQ(offers("rolvane show Ada\\ M"), Names{"Ada Miller"});
    EXPECT_EQ(offers("rolvane show \"Ada M"), Names{"Ada Miller"});
    EXPECT_EQ(offers("rolvane show Q"), Names{"Q$HOME `x` \"y\" 'z'"});
    EXPECT_EQ(offers("rolvane publish --group Fam"), Names{"Family & Friends"});
    EXPECT_EQ(offers("rolvane publish --group=Fam"), Names{"--group=Family & Friends"});
    EXPECT_EQ(offers("rolvane group add 'Work: all; now' B"), Names{"Bob"});
    EXPECT_EQ(offers("rolvane group choose Work:\\ all\\;\\ now Bob E"), Names{"Email"});
    EXPECT_EQ(offers("rolvane group show "), (Names{"Family & Friends", "Work: all; now"}));
    EXPECT_EQ(offers("rolvane export --vcard "), (Names{"3", "4"}));
    EXPECT_EQ(offers("rolvane import " + world.home.path() + "/fri"), Names{world.home.path() + "/friends.vcf"});
    EXPECT_EQ(offers("RolvaneManager -"), Names{"-p"});
}

// The manual page is made from the same table.
TEST_F(Completion, TheManualPageHasEveryCommandAndOption) {
    std::string page = contentsOf(ROLVANE_BINARY_DIR "/packaging/man/rolvane.1");
    std::string plain;
    for (size_t i = 0; i < page.size(); ++i)
        if (page[i] != '\\' || i + 1 >= page.size() || page[i + 1] != '-') plain += page[i];
    std::vector<std::vector<std::string>> open{{}};
    while (!open.empty()) {
        const auto command = open.back();
        open.pop_back();
        const Help told = help(command);
        std::string path;
        for (const std::string& word : command) path += " " + word;
        std::string section = plain;
        if (told.commands.empty()) {
            const size_t begin = plain.find(".SS rolvane" + path + "\n");
            ASSERT_NE(begin, std::string::npos) << path;
            section = plain.substr(begin, plain.find("\n.S", begin + 1) - begin);
        }
        for (const std::string& option : told.options)
            if (option != "--json" && option != "-h" && option != "--help" && option != "-q" && option != "--quiet") {
                EXPECT_NE(section.find(option), std::string::npos) << path << " " << option;
            }
        for (const std::string& below : told.commands) {
            auto next = command;
            next.push_back(below);
            open.push_back(next);
        }
    }
}

} // namespace
} // namespace rolvane::test
