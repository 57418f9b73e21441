#include "HelpFormatter.h"

#include "SafeText.h"
#include "Texts.h"

#include <algorithm>
#include <cctype>
#include <sstream>

namespace rolvane::cli {

namespace {

constexpr size_t kNameColumns = 30; // those of the library
constexpr size_t kNarrow = 70;      // below, a description stands in the line below the name
constexpr size_t kNarrowIndent = 6;

// "  5  not allowed": its meaning begins behind the number.
size_t indentOf(const std::string& line) {
    const bool isNumbered = line.size() > 5 && line.starts_with("  ") && std::isdigit(line[2]) && line[3] == ' ';
    return isNumbered ? line.find_first_not_of(' ', 3) : 0;
}

// Where the meaning of a row begins, behind blanks; npos of another line.
size_t meaningIn(const std::string& line) {
    const size_t blanks = line.find("  ", line.find_first_not_of(' '));
    return blanks == std::string::npos ? blanks : line.find_first_not_of(' ', blanks);
}

std::string fittedRow(const std::string& line, size_t columns) {
    const size_t meaning = meaningIn(line);
    if (columnsOf(line) < columns) return line + "\n";
    const std::string name = line.substr(0, line.find_last_not_of(' ', meaning - 1) + 1), rest = line.substr(meaning);
    const std::string indent(kNarrowIndent, ' ');
    return name + "\n" + indent + wrapped(rest, columns, kNarrowIndent) + "\n";
}

} // namespace

std::string fitted(const std::string& text, size_t columns) {
    if (columns == 0) return text;
    std::string out, prose;
    const auto endProse = [&] {
        if (!prose.empty()) out += wrapped(prose, columns, 0) + "\n";
        prose.clear();
    };
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        const size_t indent = indentOf(line);
        if (indent == 0 && meaningIn(line) == std::string::npos) {
            prose += line + " ";
            continue;
        }
        endProse();
        out += indent > 0 ? line.substr(0, indent) + wrapped(line.substr(indent), columns, indent) + "\n"
                          : fittedRow(line, columns);
    }
    endProse();
    return out;
}

std::string wrapped(const std::string& text, size_t columns, size_t indent) {
    if (columns == 0) return text;
    std::string out;
    size_t taken = indent;
    std::istringstream words(text);
    for (std::string word; words >> word;) {
        const size_t width = columnsOf(word);
        const bool isFirst = taken == indent;
        if (!isFirst && taken + 1 + width >= columns) {
            out += "\n" + std::string(indent, ' ');
            taken = indent;
        } else if (!isFirst) {
            out += ' ';
            taken++;
        }
        out += word;
        taken += width;
    }
    return out;
}

std::string HelpFormatter::row(const std::string& name, const std::string& description) const {
    const bool isNarrow = _columns > 0 && _columns < kNarrow;
    const size_t indent = isNarrow ? kNarrowIndent : kNameColumns;
    std::string line = "  " + wrapped(name, _columns, kNarrowIndent);
    if (description.empty()) return line + "\n";
    const size_t width = columnsOf(line);
    if (isNarrow || width >= indent || line.find('\n') != std::string::npos)
        line += "\n" + std::string(indent, ' ');
    else
        line += std::string(indent - width, ' ');
    return line + wrapped(description, _columns, indent) + "\n";
}

std::string HelpFormatter::make_subcommand(const CLI::App* command) const {
    return row(command->get_name(), command->get_description());
}

std::string HelpFormatter::make_option(const CLI::Option* option, bool isPositional) const {
    return row(make_option_name(option, isPositional) + make_option_opts(option), make_option_desc(option));
}

std::string HelpFormatter::make_expanded(const CLI::App* group) const {
    std::string text = "\n" + make_description(group);
    if (text.ends_with('\n')) text.pop_back();
    text += ":\n";
    for (const CLI::Option* option : group->get_options())
        if (option != group->get_help_ptr()) text += make_option(option, false);
    return text;
}

std::string HelpFormatter::make_description(const CLI::App* command) const {
    std::string text = command->get_description();
    if (command->get_require_option_max() == 1) text += translated(" (one of these)");
    return text.empty() ? text : wrapped(text, _columns, 0) + "\n";
}

std::string HelpFormatter::make_usage(const CLI::App* command, std::string name) const {
    std::string text = CLI::Formatter::make_usage(command, std::move(name));
    if (_columns == 0 || !text.ends_with('\n')) return text;
    text.pop_back();
    return wrapped(text, _columns, 0) + "\n";
}

std::string HelpFormatter::make_footer(const CLI::App* command) const {
    std::string text;
    std::istringstream lines(command->get_footer());
    for (std::string line; std::getline(lines, line); text += "\n") {
        const size_t indent = indentOf(line);
        const bool isCommand = indent == 0 && line.starts_with(' ');
        text +=
            isCommand || line.empty() ? line : line.substr(0, indent) + wrapped(line.substr(indent), _columns, indent);
    }
    return text;
}

} // namespace rolvane::cli
