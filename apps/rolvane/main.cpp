#include "Context.h"

#include <iostream>

namespace {

constexpr const char* kDescription =
    "Rolvane shares parts of your contacts with other people and keeps every copy in step.";

constexpr const char* kFooter = R"(Exit codes:
  0  done                      4  part of the input was refused; each refusal is named
  1  it could not be done      5  not allowed
  2  wrong command line        6  the store or the daemon was not reached in time
  3  no such thing, or several of that name

Data goes to standard output, messages to standard error. `rolvane COMMAND --help` tells more.)";

} // namespace

int main(int argc, char** argv) {
    using namespace rolvane;
    using namespace rolvane::cli;

    CLI::App app(kDescription, "rolvane");
    Context context;
    app.footer(kFooter);
    app.set_version_flag("--version", "rolvane " ROLVANE_VERSION);
    app.require_subcommand(1);
    app.fallthrough();
    app.add_flag("--json", context.json, "Print data as one JSON document");
    app.add_flag("-q,--quiet", context.quiet, "No messages but errors");
    addContactCommands(app, context);
    addGroupCommands(app, context);
    addAccountCommands(app, context);
    addSharingCommands(app, context);
    addDaemonCommands(app, context);
    addPreferencesCommands(app, context);
    addStoreCommands(app, context);

    try {
        app.parse(argc, argv);
        std::cout.flush();
        if (!std::cout) {
            std::cerr << "rolvane: standard output could not be written. Is the disk full, or the reader gone?\n";
            return kFailed;
        }
        return context.exitCode;
    } catch (const CLI::ParseError& error) {
        const int code = app.exit(error);
        return code == 0 ? kOk : kUsage;
    } catch (const CommandError& error) {
        std::cerr << "rolvane: " << error.reason() << "\n";
        return error.code();
    } catch (const CXException& error) {
        std::cerr << "rolvane: " << error.reason() << "\n";
        return kFailed;
    }
}
