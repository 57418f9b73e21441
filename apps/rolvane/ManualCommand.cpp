#include "ManualCommand.h"

#include "Completion.h"
#include "Examples.h"
#include "HelpCommand.h"

#include "daemon/DaemonOptions.h"

#include <fmt/format.h>
#include <iostream>
#include <sstream>

namespace rolvane::cli {

namespace {

// As it stands, whatever Markdown makes of its characters.
std::string literal(std::string_view text) {
    std::string out;
    for (const char c : text) {
        if (std::string_view("\\`*_{}[]<>()#+-.!|~^").find(c) != std::string_view::npos) out += '\\';
        out += c;
    }
    return out;
}

std::string sentence(const std::string& text) {
    return literal(text) + (text.ends_with('.') ? "\n" : ".\n");
}

// "GROUP", or "{3|4}" for one of a set.
std::string valueText(const CLI::Option& option) {
    const std::string type = option.get_type_name();
    const size_t brace = type.find(":{");
    if (brace == std::string::npos) return type.substr(0, type.find(':'));
    std::string set = type.substr(brace + 1);
    for (char& c : set)
        if (c == ',') c = '|';
    return set;
}

void printOption(const CLI::Option& option) {
    std::string names;
    for (const std::string& name : option.get_snames())
        names += (names.empty() ? "**" : ", **") + literal("-" + name) + "**";
    for (const std::string& name : option.get_lnames())
        names += (names.empty() ? "**" : ", **") + literal("--" + name) + "**";
    if (option.get_positional()) names = "*" + literal(option.get_name(true)) + "*";
    if (option.get_items_expected_max() > 0 && !option.get_positional())
        names += " *" + literal(valueText(option)) + "*";
    std::string text = option.get_description();
    if (!option.get_default_str().empty()) text += " (default " + option.get_default_str() + ")";
    std::cout << names << "\n\n: " << sentence(text) << "\n";
}

bool isCommon(const CLI::Option& option) {
    return option.check_name("--help") || option.check_name("--json") || option.check_name("--quiet");
}

void printCommands(const CLI::App& command, const std::string& path) {
    const auto below = shownCommands(command);
    for (const CLI::App* each : below)
        printCommands(*each, path.empty() ? each->get_name() : path + " " + each->get_name());
    if (!below.empty()) return;
    std::cout << "## rolvane " << literal(path) << "\n\n" << sentence(command.get_description()) << "\n";
    for (const CLI::Option* option : shownOptions(command))
        if (!isCommon(*option)) printOption(*option);
    const std::string lines = exampleOf(path);
    if (lines.empty()) return;
    std::cout << "For example:\n\n";
    std::istringstream stream(lines);
    for (std::string line; std::getline(stream, line);) std::cout << "  " << line << "\n"; // two blanks are there
    std::cout << "\n";
}

} // namespace

int manual(const CLI::App& rolvane, int argc, char** argv) {
    const std::string part = argc == 3 ? argv[2] : "";
    if (part == "commands") {
        printCommands(rolvane, "");
    } else if (part == "options") {
        for (const CLI::Option* option : shownOptions(rolvane)) printOption(*option);
    } else if (part == "daemon-options") {
        for (const DaemonOption& option : kDaemonOptions)
            std::cout << "**" << literal(option.name) << "**\n\n: " << sentence(option.help) << "\n";
    } else if (part == "exit-codes") {
        for (const auto& [code, meaning] : exitCodeTexts())
            std::cout << fmt::format("**{}**\n\n: {}\n", static_cast<int>(code), sentence(meaning));
    } else {
        throw CommandError(kUsage, "rolvane manual: name the part: options, commands, exit-codes or daemon-options.");
    }
    return kOk;
}

} // namespace rolvane::cli
