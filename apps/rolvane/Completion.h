#pragma once

#include <CLI/CLI.hpp>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::cli {

// The table of a program, as --help shows it: commands, and options with those of the groups of options.
std::vector<const CLI::App*> shownCommands(const CLI::App& command);
std::vector<const CLI::Option*> shownOptions(const CLI::App& command);

// Completion of a command line, from the same table of commands and options that is parsed. Pure functions.

// Where the last of the words stands.
struct CompletionPoint {
    const CLI::App* command = nullptr;        // the innermost command before it; null when a word names none
    const CLI::Option* value = nullptr;       // the option or argument that it is a value of
    bool isOption = false;                    // it is the name of an option
    std::string before;                       // "--group=" where name and value are one word
    std::string begun;                        // what is there of the value or name
    std::map<std::string, std::string> given; // options before it, by long name ("directory"), with their values
};
// `words` are those behind the program's name; the last one is to be completed and may be empty.
CompletionPoint completionPoint(const CLI::App& program, const std::vector<std::string>& words);

struct Offer {
    std::string text, help;
};
// Commands, options, or the values of a set: what the table itself knows.
std::vector<Offer> offersOfTable(const CompletionPoint& point);

// The words of a line as a POSIX shell would part it, up to the cursor; variables and such are not replaced.
struct ShellLine {
    std::vector<std::string> words; // without quotes; the last one may be empty
    char quote = 0;                 // that is open at the end, 0 for none
    size_t kept = 0;                // bytes at the beginning of the last word that the editor keeps
};
// `breaks` holds the characters behind which the editor begins to replace.
ShellLine shellLine(std::string_view line, std::string_view breaks);
// As text behind that quote (or none) stands for it.
std::string shellQuoted(std::string_view text, char quote);

} // namespace rolvane::cli
