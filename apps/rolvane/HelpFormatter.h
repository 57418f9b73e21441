#pragma once

#include <CLI/CLI.hpp>
#include <string>

namespace rolvane::cli {

// The lines of a help, in as many columns as there are; descriptions go on below their beginning. `columns` is 0 where
// the reader is no terminal: then nothing is broken into lines.
class HelpFormatter : public CLI::Formatter {
public:
    explicit HelpFormatter(size_t columns) : _columns(columns) {}

    std::string make_subcommand(const CLI::App* command) const override;
    std::string make_option(const CLI::Option* option, bool isPositional) const override;
    // A group of options that exclude one another: its description, and the options.
    std::string make_expanded(const CLI::App* group) const override;
    std::string make_description(const CLI::App* command) const override;
    std::string make_usage(const CLI::App* command, std::string name) const override;
    std::string make_footer(const CLI::App* command) const override;

private:
    std::string row(const std::string& name, const std::string& description) const;
    size_t _columns;
};

// The text with line feeds so that no line takes more than `columns`, but for words that are longer; lines behind the
// first begin with `indent` blanks. The first line begins in column `indent`. All of it in one line for 0 columns.
std::string wrapped(const std::string& text, size_t columns, size_t indent);

// A text of several lines, made to fit. Numbered lines ("  3  meaning") and rows ("path   meaning") stay lines of their
// own, and their meanings go on below. Other lines are prose and become one paragraph. As it is for 0 columns.
std::string fitted(const std::string& text, size_t columns);

} // namespace rolvane::cli
