#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/CXException.h"
#include "foundation/DaemonNotifications.h"

#include <CLI/CLI.hpp>
#include <functional>
#include <iosfwd>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>

namespace rolvane::cli {

// Exit codes, the same for every command; `rolvane --help` lists them.
enum ExitCode : int {
    kOk = 0,
    kFailed = 1,   // it could not be done; the message says why
    kUsage = 2,    // the command line is wrong
    kNotFound = 3, // what was named does not exist, or the name fits several
    kPartly = 4,   // some of the input was taken and some refused; each refusal is named
    kRefused =
        5, // not allowed: a read-only copy, a wrong password, no right on the store, a question not answered with yes
    kUnreachable = 6, // the store or the daemon could not be reached in time
};

// Ends a command with its exit code and a message for standard error: what happened, to what, what to do.
class CommandError : public CXException {
public:
    CommandError(ExitCode code, std::string message) : CXException("CommandError", std::move(message)), _code(code) {}
    ExitCode code() const { return _code; }

private:
    ExitCode _code;
};

// What every command gets: where output goes, and the things that it works on, opened on first use.
// These functions print names and texts without control characters, so that no text steers a terminal (SafeText.h).
// Data goes to standard output (a table for people, one JSON document with --json); talk goes to standard error.
class Context {
public:
    Context();
    ~Context();

    bool json = false;   // --json, accepted before and behind the command's name
    bool quiet = false;  // --quiet: no talk but errors
    std::string command; // which one runs: "group add"
    int exitCode = kOk;  // what the command ends with when nothing is thrown

    CXRolvane& database(); // the user's contact database
    DaemonLink& bus();     // the session bus and the daemon's socket, as far as there are any
    RunLoop& loop();

    void print(const nlohmann::ordered_json& data); // one JSON document and a line end
    void line(const std::string& text);             // a line of data
    // A line of data with its label in a column of its own.
    void row(const std::string& label, const std::string& text, size_t column = 15);
    void say(const std::string& text);  // a line of talk, unless --quiet
    void warn(const std::string& text); // a line on standard error, always
    bool talkIsTerminal() const;        // standard error is a terminal
    bool dataIsTerminal() const;
    size_t dataColumns() const; // of the terminal that standard output is; 0 for any other

private:
    struct Impl;
    std::unique_ptr<Impl> _impl;
};

// A progress bar on standard error: drawn in place on a terminal, one line at every tenth elsewhere, nothing with
// --quiet. Ends its line when it is destroyed.
class ProgressBar {
public:
    ProgressBar(Context& context, std::string label);
    ~ProgressBar();
    void update(double fraction, const std::string& note = {}); // 0..1

private:
    Context& _context;
    std::string _label;
    int _shown = -1;
    bool _open = false;
};

// Puts what the help says of a command's options into the person's language.
void translateOptions(CLI::App& command);

// Adds a command whose body runs after the whole line has been parsed. The body throws or sets context.exitCode.
CLI::App* addCommand(CLI::App& parent, Context& context, const std::string& name, const std::string& description,
                     const std::function<void(CLI::App&)>& declare, std::function<void()> body);

// Each file of commands has one of these.
void addContactCommands(CLI::App& app, Context& context);      // import export list show add edit delete
void addDuplicateCommands(CLI::App& app, Context& context);    // duplicates merge
void addGroupCommands(CLI::App& app, Context& context);        // group …
void addAccountCommands(CLI::App& app, Context& context);      // account …
void addSharingCommands(CLI::App& app, Context& context);      // publish unpublish sync
void addSubscriptionCommands(CLI::App& app, Context& context); // subscribe unsubscribe subscriptions
void addShareCommands(CLI::App& app, Context& context);        // share unshare shares rights
void addWithdrawnCommands(CLI::App& app, Context& context);    // withdrawn …
void addConflictCommands(CLI::App& app, Context& context);     // conflicts …
void addDaemonCommands(CLI::App& app, Context& context);       // daemon … status watch
void addPreferencesCommands(CLI::App& app, Context& context);  // defaults …
void addStoreCommands(CLI::App& app, Context& context);        // store …
void addBooksCommands(CLI::App& app, Context& context);        // books …
void addDatabaseCommands(CLI::App& app, Context& context);     // new-database

} // namespace rolvane::cli
