#include "Completion.h"

#include <algorithm>

namespace rolvane::cli {

std::vector<const CLI::App*> shownCommands(const CLI::App& command) {
    return command.get_subcommands([](const CLI::App* c) { return !c->get_name().empty() && !c->get_group().empty(); });
}

std::vector<const CLI::Option*> shownOptions(const CLI::App& command) {
    auto all = command.get_options([](const CLI::Option* o) { return !o->get_group().empty(); });
    for (const CLI::App* group : command.get_subcommands([](const CLI::App* c) { return c->get_name().empty(); }))
        for (const CLI::Option* option : shownOptions(*group)) all.push_back(option);
    return all;
}

namespace {

bool takesValue(const CLI::Option& option) {
    return option.get_items_expected_max() > 0;
}

// By "--name" or "-n"; those of the commands around it may stand behind it, too.
const CLI::Option* optionNamed(const CLI::App& command, const std::string& name) {
    for (const CLI::App* at = &command; at; at = at->get_parent())
        for (const CLI::Option* option : shownOptions(*at))
            if (option->check_name(name)) return option;
    return nullptr;
}

// The argument that the word at this place belongs to, counted from 0.
const CLI::Option* argumentAt(const CLI::App& command, size_t place) {
    for (const CLI::Option* option : shownOptions(command)) {
        if (!option->get_positional()) continue;
        const auto most = static_cast<size_t>(std::max(option->get_items_expected_max(), 0));
        if (place < most) return option;
        place -= most;
    }
    return nullptr;
}

class Walk {
public:
    explicit Walk(const CLI::App& program) { _point.command = &program; }

    void pass(const std::string& word) {
        if (const CLI::Option* option = std::exchange(_awaiting, nullptr))
            give(*option, word);
        else if (_onlyArguments || !word.starts_with('-') || word == "-")
            passPlain(word);
        else if (word == "--")
            _onlyArguments = true;
        else
            passOption(word);
    }

    CompletionPoint endAt(const std::string& word) && {
        _point.begun = word;
        if (!_point.command) return _point;
        if (_awaiting) {
            _point.value = _awaiting;
        } else if (!_onlyArguments && word.starts_with('-')) {
            const size_t equals = word.find('=');
            const CLI::Option* option =
                equals == std::string::npos ? nullptr : optionNamed(*_point.command, word.substr(0, equals));
            _point.isOption = equals == std::string::npos;
            if (option && takesValue(*option)) {
                _point.value = option;
                _point.before = word.substr(0, equals + 1);
                _point.begun = word.substr(equals + 1);
            }
        } else {
            _point.value = argumentAt(*_point.command, _arguments);
        }
        return _point;
    }

private:
    void passPlain(const std::string& word) {
        if (!_point.command) return;
        const auto below = shownCommands(*_point.command);
        if (below.empty()) {
            ++_arguments;
            return;
        }
        const auto found = std::find_if(below.begin(), below.end(),
                                        [&](const CLI::App* command) { return command->get_name() == word; });
        _point.command = found == below.end() ? nullptr : *found;
    }

    void passOption(const std::string& word) {
        if (!_point.command) return;
        const size_t equals = word.find('=');
        const bool isLong = word.starts_with("--");
        const std::string name = isLong ? word.substr(0, equals) : word.substr(0, 2);
        const CLI::Option* option = optionNamed(*_point.command, name);
        if (!option || !takesValue(*option)) return;
        if (isLong && equals != std::string::npos)
            give(*option, word.substr(equals + 1));
        else if (!isLong && word.size() > 2)
            give(*option, word.substr(2));
        else
            _awaiting = option;
    }

    void give(const CLI::Option& option, const std::string& value) {
        for (const std::string& name : option.get_lnames()) _point.given[name] = value;
    }

    CompletionPoint _point;
    const CLI::Option* _awaiting = nullptr;
    bool _onlyArguments = false;
    size_t _arguments = 0;
};

// "TEXT:{3,4}" has two.
std::vector<Offer> offersOfSet(const std::string& type) {
    std::vector<Offer> all;
    const size_t begin = type.find('{'), end = type.rfind('}');
    if (begin == std::string::npos || end == std::string::npos || end < begin) return all;
    for (size_t i = begin + 1; i <= end;) {
        const size_t comma = std::min(type.find(',', i), end);
        all.push_back({type.substr(i, comma - i), ""});
        i = comma + 1;
    }
    return all;
}

} // namespace

CompletionPoint completionPoint(const CLI::App& program, const std::vector<std::string>& words) {
    Walk walk(program);
    for (size_t i = 0; i + 1 < words.size(); ++i) walk.pass(words[i]);
    return std::move(walk).endAt(words.empty() ? std::string() : words.back());
}

std::vector<Offer> offersOfTable(const CompletionPoint& point) {
    std::vector<Offer> all;
    if (!point.command) return all;
    if (point.isOption) {
        for (const CLI::Option* option : shownOptions(*point.command)) {
            for (const std::string& name : option->get_snames()) all.push_back({"-" + name, option->get_description()});
            for (const std::string& name : option->get_lnames())
                all.push_back({"--" + name, option->get_description()});
        }
    } else if (point.value) {
        all = offersOfSet(point.value->get_type_name());
    } else {
        for (const CLI::App* command : shownCommands(*point.command))
            all.push_back({command->get_name(), command->get_description()});
    }
    std::erase_if(all, [&](const Offer& offer) { return !offer.text.starts_with(point.begun); });
    return all;
}

ShellLine shellLine(std::string_view line, std::string_view breaks) {
    ShellLine parted;
    std::string word;
    size_t behindBreak = 0, behindQuote = 0; // where the replacement may begin, in the word
    bool inWord = false;
    char quote = 0;
    for (size_t i = 0; i < line.size(); ++i) {
        const char c = line[i];
        const bool isBlank = c == ' ' || c == '\t' || c == '\n';
        if (quote == '\'' ? c != quote : quote == '"' && c != quote && c != '\\') {
            word += c;
        } else if (c == '\\') {
            inWord = true;
            if (++i == line.size()) break;
            // Within double quotes a backslash stands for itself before most characters.
            if (quote && std::string_view("$`\"\\\n").find(line[i]) == std::string_view::npos) word += '\\';
            word += line[i];
        } else if (quote) {
            quote = 0;
        } else if (c == '"' || c == '\'') {
            quote = c;
            inWord = true;
            behindQuote = word.size();
        } else if (isBlank) {
            if (inWord) parted.words.push_back(word);
            word.clear();
            inWord = false;
            behindBreak = 0;
        } else {
            inWord = true;
            word += c;
            if (breaks.find(c) != std::string_view::npos) behindBreak = word.size();
        }
    }
    parted.words.push_back(word);
    parted.quote = quote;
    parted.kept = quote ? behindQuote : behindBreak;
    return parted;
}

std::string shellQuoted(std::string_view text, char quote) {
    std::string out;
    const std::string_view special = quote == '"' ? "$`\"\\" : " \t|&;()<>*?[]{}$`\"'\\!#~^";
    for (const char c : text) {
        if (quote == '\'') {
            out += c == '\'' ? "'\\''" : std::string(1, c);
            continue;
        }
        if (special.find(c) != std::string_view::npos) out += '\\';
        out += c;
    }
    return out;
}

} // namespace rolvane::cli
