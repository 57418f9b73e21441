#include "BackupCommands.h"
#include "CompleteCommand.h"
#include "Completion.h"
#include "Computers.h"
#include "Context.h"
#include "HelpCommand.h"
#include "HelpFormatter.h"
#include "LineComplaint.h"
#include "LogCommands.h"
#include "ManualCommand.h"
#include "PlanCommand.h"
#include "SafeText.h"
#include "SeeingCommands.h"
#include "SetupCommands.h"
#include "Suggestions.h"
#include "Terminal.h"
#include "Texts.h"

#include "contacts/database/DaemonMemory.h"
#include "foundation/Preferences.h"

#include <algorithm>
#include <iostream>
#include <unistd.h>

namespace {

constexpr const char* kExamples =
    R"(  rolvane import friends.vcf
  rolvane setup
  rolvane setup 'rolvane:1:...'
  rolvane publish && rolvane watch
  rolvane subscribe bob && rolvane list --of bob)";

// Where the words of the line lead: the innermost command, and the word that is no command where one is needed.
struct Named {
    const CLI::App* command;
    std::string unknown;
};

Named namedCommand(const CLI::App& app, int argc, char** argv) {
    const auto isCommand = [](const CLI::App* c) { return !c->get_name().empty(); }; // a group of options has no name
    const CLI::App* command = &app;
    for (int i = 1; i < argc && !command->get_subcommands(isCommand).empty(); ++i) {
        const std::string word = argv[i];
        if (word.starts_with('-')) continue;
        const auto below = command->get_subcommands([&](const CLI::App* c) { return c->get_name() == word; });
        if (below.empty()) return {command, word};
        command = below.front();
    }
    return {command, {}};
}

std::string nameOf(const CLI::App& command) {
    return (command.get_parent() ? nameOf(*command.get_parent()) + " " : "") + command.get_name();
}

std::vector<std::string> namesBelow(const CLI::App& command) {
    std::vector<std::string> names;
    for (const CLI::App* below : rolvane::cli::shownCommands(command)) names.push_back(below->get_name());
    return names;
}

// Help and version go to standard output; what is wrong with the line goes to standard error, with what to do.
int endWith(const CLI::App& app, const CLI::ParseError& error, int argc, char** argv) {
    using namespace rolvane::cli;
    if (error.get_exit_code() == 0) return app.exit(error);
    if (argc == 1) {
        std::cerr << app.help();
        return kUsage;
    }
    const auto [command, unknown] = namedCommand(app, argc, argv);
    std::string what = unknown.empty() ? complaintAboutLine(error.what())
                                       : tr("There is no command \"{}\"", nameOf(*command) + " " + unknown);
    if (what.ends_with('.')) what.pop_back();
    std::cerr << shownText("rolvane: " + what + "." + didYouMean(suggestions(unknown, namesBelow(*command))) +
                           tr(" `{} --help` shows what can be given.", nameOf(*command)) + "\n");
    return kUsage;
}

// The words of the library that writes the help.
void translateHeadings(CLI::App& app) {
    using rolvane::cli::marked;
    using rolvane::cli::translated;
    for (const char* word : {marked("Usage"), marked("OPTIONS"), marked("SUBCOMMAND"), marked("SUBCOMMANDS"),
                             marked("Positionals"), marked("REQUIRED"), marked("Needs"), marked("Excludes")})
        app.get_formatter()->label(word, translated(word));
    app.set_help_flag("-h,--help", translated("Print this help message and exit"));
}

// Documents, candidates of the shells and manual pages are for programs: the same in every language.
bool isForAPerson(int argc, char** argv) {
    const std::string_view first = argc > 1 ? argv[1] : "";
    return first != "complete" && first != "manual" &&
           std::none_of(argv, argv + argc, [](const char* word) { return std::string_view(word) == "--json"; });
}

} // namespace

int main(int argc, char** argv) {
    using namespace rolvane;
    using namespace rolvane::cli;

    if (isForAPerson(argc, argv)) useLanguageOfThePerson();
    CLI::App app(translated("Rolvane shares parts of your contacts with other people and keeps every copy in step."),
                 "rolvane");
    app.formatter(std::make_shared<HelpFormatter>(terminalColumns(STDOUT_FILENO)));
    translateHeadings(app);
    Context context;
    app.footer(exitCodeLines() + "\n" +
               translated("Data goes to standard output, messages to standard error. `rolvane COMMAND --help` tells "
                          "more.") +
               "\n\n" + translated("Examples:") + "\n" + kExamples);
    app.set_version_flag("--version", "rolvane " ROLVANE_VERSION,
                         translated("Display program version information and exit"));
    app.require_subcommand(1);
    app.fallthrough();
    app.add_flag("--json", context.json, "Print data as one JSON document");
    app.add_flag("-q,--quiet", context.quiet, "No messages but errors");
    translateOptions(app);
    addContactCommands(app, context);
    addDuplicateCommands(app, context);
    addGroupCommands(app, context);
    addAccountCommands(app, context);
    addSetupCommands(app, context);
    addInviteCommands(app, context);
    addDoctorCommands(app, context);
    addSharingCommands(app, context);
    addShareCommands(app, context);
    addSubscriptionCommands(app, context);
    addComputerCommands(app, context);
    addWithdrawnCommands(app, context);
    addConflictCommands(app, context);
    addDaemonCommands(app, context);
    addPreferencesCommands(app, context);
    addStoreCommands(app, context);
    addBooksCommands(app, context);
    addDatabaseCommands(app, context);
    addBackupCommands(app, context);
    addSeeingCommands(app, context);
    addPlanCommand(app, context);
    addLogCommands(app, context);
    addHelpCommand(app, context);

    try {
        if (argc > 1 && std::string_view(argv[1]) == "complete") {
            Preferences::shared().keepElsewhere(daemonMemory());
            return complete(app, argc, argv);
        }
        if (argc > 1 && std::string_view(argv[1]) == "manual") return manual(app, argc, argv);
        app.parse(argc, argv);
        std::cout.flush();
        if (!std::cout) {
            std::cerr << "rolvane: "
                      << translated("standard output could not be written. Is the disk full, or the reader gone?")
                      << "\n";
            return kFailed;
        }
        return context.exitCode;
    } catch (const CLI::ParseError& error) {
        return endWith(app, error, argc, argv);
    } catch (const CommandError& error) {
        context.warn("rolvane: " + error.reason());
        return error.code();
    } catch (const CXException& error) {
        context.warn("rolvane: " + error.reason());
        return kFailed;
    }
}
