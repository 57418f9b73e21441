#include "CommandWorld.h"

#include <filesystem>
#include <regex>

namespace rolvane::test {
namespace {

class CommandLine : public testing::Test {
protected:
    // Every command that a help text lists, with its parents before it: "group add".
    void collect(const std::vector<std::string>& command, std::vector<std::vector<std::string>>& all) {
        auto arguments = command;
        arguments.push_back("--help");
        const std::string help = world.done(arguments);
        const size_t begin = help.find("Subcommands:\n");
        if (begin == std::string::npos) return;
        std::istringstream lines(help.substr(begin + 13));
        for (std::string line; std::getline(lines, line) && line.starts_with("  ");) {
            auto below = command;
            below.push_back(line.substr(2, line.find(' ', 2) - 2));
            all.push_back(below);
            collect(below, all);
        }
    }
    CommandWorld world;
};

TEST_F(CommandLine, WithoutArgumentsTheHelpIsTalkAndTheExitCodeIsTwo) {
    const Ran ran = world.rolvane({});
    EXPECT_EQ(ran.status, kWrongLine);
    EXPECT_EQ(ran.output, "");
    EXPECT_NE(ran.errors.find("Subcommands:"), std::string::npos) << ran;
}

TEST_F(CommandLine, TheHelpIsDataAndListsTheExitCodes) {
    const std::string help = world.done({"--help"});
    for (const char* code : {"0  done", "1  it could not be done", "2  wrong command line", "3  no such thing",
                             "4  part of the input", "5  not allowed", "6  the store or the daemon"})
        EXPECT_NE(help.find(code), std::string::npos) << code;
}

TEST_F(CommandLine, EveryCommandExplainsItself) {
    std::vector<std::vector<std::string>> all;
    collect({}, all);
    EXPECT_GE(all.size(), 40U);
    for (auto command : all) {
        command.push_back("--help");
        const Ran ran = world.rolvane(command);
        EXPECT_EQ(ran.status, kDone) << ran;
        EXPECT_EQ(ran.errors, "");
        EXPECT_NE(ran.output.find("exit codes"), std::string::npos) << ran;
    }
}

TEST_F(CommandLine, TheExamplesOfTheHelpNameOptionsThatExist) {
    std::vector<std::vector<std::string>> all;
    collect({}, all);
    for (auto command : all) {
        std::string name = "rolvane";
        for (const std::string& word : command) name += " " + word;
        command.push_back("--help");
        const std::string help = world.done(command);
        const size_t examples = help.find("Examples:\n");
        if (examples == std::string::npos) continue;
        const std::string options = help.substr(0, examples), text = help.substr(examples);
        EXPECT_NE(text.find(name), std::string::npos) << name << " has examples of something else:\n" << text;
        const std::regex option("--[a-z][a-z0-9-]*");
        for (std::sregex_iterator found(text.begin(), text.end(), option), end; found != end; ++found)
            if (found->str() != "--help") {
                EXPECT_NE(options.find(found->str()), std::string::npos) << name << " knows no " << found->str();
            }
    }
}

TEST_F(CommandLine, AnUnknownCommandIsNamedTogetherWithTheHelpThatListsThem) {
    EXPECT_TRUE(saysOnce(world.rolvane({"gruop", "list"}), kWrongLine, "There is no command \"rolvane gruop\""));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "lst"}), kWrongLine, "`rolvane group --help`"));
    EXPECT_TRUE(saysOnce(world.rolvane({"store", "user", "ad"}), kWrongLine, "`rolvane store user --help`"));
}

TEST_F(CommandLine, AnUnknownOptionIsNamedTogetherWithTheCommandsHelp) {
    const Ran ran = world.rolvane({"list", "--frobnicate"});
    EXPECT_TRUE(saysOnce(ran, kWrongLine, "--frobnicate"));
    EXPECT_TRUE(saysOnce(ran, kWrongLine, "`rolvane list --help`"));
}

TEST_F(CommandLine, WhatIsMissingIsNamed) {
    EXPECT_TRUE(saysOnce(world.rolvane({"group"}), kWrongLine, "A command is missing behind this one"));
    EXPECT_TRUE(saysOnce(world.rolvane({"show"}), kWrongLine, "names"));
    EXPECT_TRUE(saysOnce(world.rolvane({"group", "rename", "Family"}), kWrongLine, "name"));
}

TEST_F(CommandLine, AValueThatIsOutOfRangeIsRefused) {
    EXPECT_TRUE(saysOnce(world.rolvane({"sync", "--timeout", "-1"}), kWrongLine, "--timeout"));
    EXPECT_TRUE(saysOnce(world.rolvane({"export", "--vcard", "5"}), kWrongLine, "--vcard"));
    EXPECT_TRUE(saysOnce(world.rolvane({"defaults", "write", "k", "v", "--type", "colour"}), kWrongLine, "--type"));
}

TEST_F(CommandLine, TheVersionIsData) {
    EXPECT_TRUE(std::regex_match(world.done({"--version"}), std::regex("rolvane [0-9]+\\.[0-9]+.*\n")));
}

TEST_F(CommandLine, WhoAsksForVersionOrHelpAloneFindsNothingNewAtHome) {
    for (const char* question : {"--version", "--help"}) world.done({question});
    world.rolvane({});
    size_t found = 0;
    for (const auto& each : std::filesystem::recursive_directory_iterator(world.home.path()))
        if (!each.is_directory() || each.path().filename() == "rolvane") {
            ADD_FAILURE() << each.path();
            ++found;
        }
    EXPECT_EQ(found, 0U);
}

TEST_F(CommandLine, JsonMayStandBeforeOrBehindTheCommand) {
    EXPECT_EQ(world.done({"--json", "list"}), world.done({"list", "--json"}));
    EXPECT_EQ(nlohmann::json::parse(world.done({"--json", "list"})), nlohmann::json::array());
}

TEST_F(CommandLine, QuietSilencesTalkButNotErrors) {
    const Ran added = world.rolvane({"-q", "add", "--first", "Ada"});
    EXPECT_EQ(added.errors, "");
    EXPECT_NE(added.output, "");
    EXPECT_TRUE(saysOnce(world.rolvane({"-q", "show", "Nobody"}), kNoSuchThing, "Nobody"));
}

TEST_F(CommandLine, AStandardOutputThatTakesNothingIsAnError) {
    world.add("Ada");
    const Ran ran = world.run({"/bin/sh", "-c", "exec \"$0\" list > /dev/full", UserWorld::rolvaneProgram()});
    EXPECT_TRUE(saysOnce(ran, kFailure, "standard output"));
}

} // namespace
} // namespace rolvane::test
