#include "HelpCommand.h"

#include "HelpFormatter.h"
#include "Suggestions.h"
#include "Terminal.h"
#include "Texts.h"

#include <algorithm>
#include <fmt/format.h>
#include <iostream>
#include <unistd.h>

namespace rolvane::cli {

namespace {

struct Topic {
    const char* name;
    const char* about;
    std::string text;
};

const std::vector<Topic>& topics() {
    static const std::vector<Topic> all{
        {"names", translated("How people and groups are named"),
         translated("A person or group is named by its identifier, the start of one (four characters at least), its "
                    "name, or a\n"
                    "part of its name that fits nobody else. Letter case does not matter. Where several fit, they are "
                    "listed and\n"
                    "nothing is done. To delete, a part of a name is not enough. `rolvane list --full` shows the "
                    "identifiers.\n")},
        {"output", translated("Where data and messages go"),
         translated("Data goes to standard output, messages to standard error. With --json every command that prints "
                    "data prints\n"
                    "one JSON document instead of a table; --quiet leaves out every message but errors. Other people's "
                    "texts are\n"
                    "shown without the characters that would steer a terminal.\n")},
        {"files", translated("Where everything lies"),
         translated(
             "~/.local/share/rolvane/contacts.db         the contacts, and the daemon's memory of them\n"
             "~/.local/share/rolvane/replaced/           what `rolvane restore` has replaced\n"
             "~/.local/state/rolvane/preferences.db      preferences, and how the last pass has ended\n"
             "~/.config/rolvane/account.plist            the account on the store; never the password\n"
             "~/.config/rolvane/password                 the password, when it was asked for with --ask-password\n"
             "~/.local/state/rolvane/RolvaneManager.log  the log of a daemon that rolvane started itself\n"
             "~/.local/state/rolvane/store/              the private store\n"
             "XDG_DATA_HOME, XDG_STATE_HOME and XDG_CONFIG_HOME say other places.\n")},
        {"exit-codes", translated("What the exit codes mean"), exitCodeLines()},
    };
    return all;
}

// The command that the words name, null when they name none.
const CLI::App* commandNamed(const CLI::App& app, const std::vector<std::string>& words) {
    const CLI::App* command = &app;
    for (const std::string& word : words) {
        const auto below = command->get_subcommands([&](const CLI::App* c) { return c->get_name() == word; });
        if (below.empty() || word.empty()) return nullptr;
        command = below.front();
    }
    return command;
}

std::string topicLines() {
    std::string text = std::string(translated("Topics:")) + "\n";
    constexpr size_t kBegin = 14; // column of the description
    for (const Topic& topic : topics())
        text += fmt::format("  {:<12}{}\n", topic.name, wrapped(topic.about, terminalColumns(STDOUT_FILENO), kBegin));
    return text;
}

void help(const CLI::App& app, const std::vector<std::string>& words) {
    if (words.size() == 1)
        for (const Topic& topic : topics())
            if (words.front() == topic.name) {
                std::cout << fitted(topic.text, terminalColumns(STDOUT_FILENO));
                return;
            }
    const CLI::App* command = commandNamed(app, words);
    if (!command) {
        std::string named;
        for (const std::string& word : words) named += (named.empty() ? "" : " ") + word;
        std::vector<std::string> known;
        for (const Topic& topic : topics()) known.emplace_back(topic.name);
        for (const CLI::App* each : app.get_subcommands([](const CLI::App* c) { return !c->get_name().empty(); }))
            known.push_back(each->get_name());
        throw CommandError(kNotFound, tr("There is no command or topic \"{}\".{} `rolvane help` lists them.", named,
                                         didYouMean(suggestions(named, known))));
    }
    std::string name = command->get_name();
    for (const CLI::App* at = command->get_parent(); at; at = at->get_parent()) name = at->get_name() + " " + name;
    // Not command->help(), which would tell of the command that was parsed.
    std::cout << app.get_formatter()->make_help(command, name, CLI::AppFormatMode::Normal);
    if (words.empty()) std::cout << "\n" << topicLines();
}

} // namespace

const std::vector<ExitCodeText>& exitCodeTexts() {
    static const std::vector<ExitCodeText> all{
        {kOk, translated("done")},
        {kFailed, translated("it could not be done; the message says why")},
        {kUsage, translated("wrong command line")},
        {kNotFound, translated("no such thing, or several of that name")},
        {kPartly, translated("part of the input was taken and part refused; each refusal is named")},
        {kRefused, translated("not allowed: a read-only copy, a wrong password, no right on the store, a question not "
                              "answered with yes")},
        {kUnreachable, translated("the store or the daemon was not reached in time")},
    };
    return all;
}

std::string exitCodeLines() {
    std::string text = std::string(translated("Exit codes:")) + "\n";
    for (const auto& [code, meaning] : exitCodeTexts())
        text += fmt::format("  {}  {}\n", static_cast<int>(code), meaning);
    return text;
}

void addHelpCommand(CLI::App& app, Context& context) {
    const auto words = std::make_shared<std::vector<std::string>>();
    addCommand(
        app, context, "help", "Tell about a command or a topic",
        [&](CLI::App& command) {
            command.add_option("topic", *words, "A command, such as: group add; or names, output, files, exit-codes");
        },
        [&app, words] { help(app, *words); });
}

} // namespace rolvane::cli
