#include "CommandWorld.h"

#include <set>
#include <sstream>

namespace rolvane::test {
namespace {

using Names = std::set<std::string>;

class Completion : public testing::Test {
protected:
    // What the shell offers for the last of the words.
    Names offered(const std::vector<std::string>& words) {
        std::vector<std::string> command{
            "bash",
            "--norc",
            "-c",
            "set -e; source \"$0\"; [[ $(complete -p rolvane) == *_rolvane* ]]; set +e; COMP_WORDS=(\"$@\"); "
            "COMP_CWORD=$(($# - 1)); _rolvane; for reply in \"${COMPREPLY[@]}\"; do printf '%s\\n' \"$reply\"; done",
            ROLVANE_SOURCE_DIR "/packaging/completions/rolvane",
            UserWorld::rolvaneProgram()};
        command.insert(command.end(), words.begin(), words.end());
        const Ran ran = world.run(command);
        EXPECT_EQ(ran.status, 0) << ran;
        EXPECT_EQ(ran.errors, "");
        Names names;
        std::istringstream lines(ran.output);
        for (std::string line; std::getline(lines, line);) names.insert(line);
        return names;
    }
    struct Help {
        Names commands, options;
    };
    Help help(std::vector<std::string> command) {
        command.push_back("--help");
        Help all;
        std::istringstream lines(world.done(command));
        bool listing = false;
        for (std::string line; std::getline(lines, line);) {
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
    void checkFrom(const std::vector<std::string>& command) {
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
    CommandWorld world;
};

TEST_F(Completion, EveryCommandAndOptionThatTheHelpListsIsOffered) {
    ASSERT_GE(help({}).commands.size(), 15U);
    checkFrom({});
}

TEST_F(Completion, OnlyWhatBeginsWithTheWordIsOffered) {
    EXPECT_EQ(offered({"pub"}), Names{"publish"});
    EXPECT_EQ(offered({"group", "re"}), (Names{"remove", "remove-group", "rename"}));
    EXPECT_EQ(offered({"export", "--gr"}), Names{"--group"});
    EXPECT_EQ(offered({"--json", "gro"}), Names{"group"});
    EXPECT_EQ(offered({"no-such-command", ""}), Names{});
}

TEST_F(Completion, PeopleAndGroupsAreOfferedByName) {
    world.add("Ada", {"--last", "Miller"});
    world.add("Bob");
    world.group("Family & Friends", {"Bob"});
    world.group("Work (all)");
    EXPECT_EQ(offered({"show", ""}), (Names{"Ada\\ Miller", "Bob"}));
    EXPECT_EQ(offered({"edit", "ada"}), Names{"Ada\\ Miller"});
    EXPECT_EQ(offered({"edit", "\"Ada M"}), Names{"Ada Miller"}) << "within quotes nothing is escaped";
    EXPECT_EQ(offered({"group", "show", ""}), (Names{"Family\\ \\&\\ Friends", "Work\\ \\(all\\)"}));
    EXPECT_EQ(offered({"publish", "--group", "f"}), Names{"Family\\ \\&\\ Friends"});
    EXPECT_EQ(offered({"group", "add", "Work (all)", "b"}), Names{"Bob"});
    EXPECT_EQ(offered({"group", "choose", "Work (all)", "Bob", "E"}), Names{"Email"});
    EXPECT_EQ(offered({"group", "create", "New", "Bo"}), Names{"Bob"});
}

TEST_F(Completion, TheValuesOfAnOptionAreOffered) {
    EXPECT_EQ(offered({"export", "--vcard", ""}), (Names{"3", "4"}));
    EXPECT_EQ(offered({"store", "start", "--authentication", ""}), (Names{"basic", "digest", "none"}));
    EXPECT_EQ(offered({"account", "set", "--authentication", ""}), (Names{"automatic", "basic", "digest"}));
    EXPECT_EQ(offered({"account", "set", "--user", ""}), Names{}) << "nobody knows it";
    const std::string file = world.write("friends.vcf", "");
    EXPECT_EQ(offered({"import", world.home / "fri"}), Names{file});
}

// The other shells' files are read as text: each has every command and option.
TEST_F(Completion, TheOtherShellsKnowTheSameCommandsAndOptions) {
    const std::string zsh = contentsOf(ROLVANE_SOURCE_DIR "/packaging/completions/_rolvane");
    const std::string fish = contentsOf(ROLVANE_SOURCE_DIR "/packaging/completions/rolvane.fish");
    std::vector<std::vector<std::string>> open{{}};
    while (!open.empty()) {
        const auto command = open.back();
        open.pop_back();
        const Help told = help(command);
        std::string path;
        for (const std::string& word : command) path += " " + word;
        for (const std::string& below : told.commands) {
            EXPECT_NE(zsh.find("'" + below + ":"), std::string::npos) << path << " " << below;
            EXPECT_NE(fish.find("-n '__rolvane_at" + path + "' -a " + below + " "), std::string::npos)
                << path << " " << below;
            auto next = command;
            next.push_back(below);
            open.push_back(next);
        }
        for (const std::string& option : told.options) {
            const std::string shown = option.starts_with("--") ? "-l " + option.substr(2) : "-s " + option.substr(1);
            const std::string condition =
                std::string("'__rolvane_") + (told.commands.empty() ? "in" : "at") + path + "'";
            bool known = false;
            std::istringstream lines(fish);
            for (std::string line; std::getline(lines, line);)
                known =
                    known || (line.find(condition) != std::string::npos && line.find(shown + " ") != std::string::npos);
            EXPECT_TRUE(known) << "fish:" << path << " " << option;
            EXPECT_NE(zsh.find(option + "["), std::string::npos) << "zsh:" << path << " " << option;
        }
    }
}

// The manual page is written from the help, and stays true to it.
TEST_F(Completion, TheManualPageHasEveryCommandAndOption) {
    std::string page = contentsOf(ROLVANE_SOURCE_DIR "/packaging/man/rolvane.1");
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
