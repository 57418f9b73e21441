#include "Context.h"
#include "FailureText.h"
#include "Terminal.h"
#include "ValueNames.h"

#include "daemon/DaemonControl.h"
#include "daemon/RetrySchedule.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "store/dav/CXDAVManager.h"

#include <filesystem>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

struct AccountOptions {
    std::string user, endpoint, secureEndpoint, host, caFile, authentication = "automatic";
    std::string passwordCommand, passwordCredential, passwordFile;
    bool askPassword = false, noPassword = false, plainLoopback = false, store = false;
};

std::string passwordPath() {
    return configDirectory() + "/password";
}

// The daemon reads the files from another directory than this one. Empty stays empty.
std::string absolutePath(const std::string& path) {
    return path.empty() ? path : std::filesystem::absolute(path).lexically_normal().string();
}

Authentication authenticationNamed(const std::string& name) {
    return name == "basic"    ? Authentication::basic
           : name == "digest" ? Authentication::digest
                              : Authentication::automatic;
}

PasswordSource passwordSource(const AccountOptions& options, const PasswordSource& former, const std::string& user) {
    using Kind = PasswordSource::Kind;
    if (options.noPassword) return {Kind::none, {}};
    if (!options.passwordCommand.empty()) return {Kind::command, options.passwordCommand};
    if (!options.passwordCredential.empty()) return {Kind::credential, options.passwordCredential};
    if (!options.passwordFile.empty()) return {Kind::file, absolutePath(options.passwordFile)};
    if (!options.askPassword) return former;
    const std::string password = readSecret("Password of " + user + ": ");
    if (password.empty()) throw CommandError(kUsage, "The password is empty. Nothing was changed.");
    writeFileDurably(passwordPath(), password + "\n", 0600);
    return {Kind::file, passwordPath()};
}

// Refuses a source that gives no password, in the source's own words.
void requirePassword(const CXDAVAccount& account) {
    try {
        (void)account.password();
    } catch (const CXException& error) {
        throw CommandError(kRefused, error.reason());
    }
}

std::optional<CXDAVAccount> savedAccount() {
    return CXDAVAccount::load();
}

// The last pass has ended for that, and the daemon with it: nothing else would start it.
bool passwordWasRefused() {
    try {
        const auto outcome = lastOutcome(Preferences::shared());
        return outcome && resultOf(*outcome).passwordRefused;
    } catch (const CXException&) {
        return false; // damaged preferences are told by whoever needs them
    }
}

void setAccount(Context& context, CLI::App& command, const AccountOptions& options) {
    const auto given = [&](const char* option) { return command.get_option(option)->count() > 0; };
    CXDAVAccount account;
    try {
        if (const auto saved = savedAccount()) account = *saved;
    } catch (const CXException& error) { // one that cannot be used is replaced by a whole new one only
        if (!given("--user") || !given("--endpoint"))
            throw CommandError(kFailed, error.reason() + " Make the account anew: give --user and --endpoint.");
    }
    const std::string formerUser = account.user.str();
    if (given("--user")) account.user = UserName(options.user);
    if (given("--endpoint")) account.endpoint = options.endpoint;
    if (given("--secure-endpoint")) account.secureEndpoint = options.secureEndpoint;
    if (given("--host")) account.nameHost = options.host;
    if (given("--ca-file")) account.caFile = absolutePath(options.caFile);
    if (given("--authentication")) account.authentication = authenticationNamed(options.authentication);
    if (given("--plain-loopback")) account.plainLoopback = options.plainLoopback;
    if (account.user.empty()) throw CommandError(kUsage, "Name the user with --user.");
    if (const auto problem = account.problem()) throw CommandError(kUsage, *problem);
    account.passwordSource = passwordSource(options, account.passwordSource, account.user.str());
    if (const auto problem = account.problem()) throw CommandError(kUsage, *problem);
    if (given("--password-file")) requirePassword(account); // a file that cannot be used is better told now
    account.save();
    context.say(fmt::format("The account of {} at {} is saved. `rolvane account test` tries it.", account.user.str(),
                            account.endpoint));
    if (const DaemonControl daemon; daemon.running()) {
        daemon.restart(); // it reads the account once
        context.say("RolvaneManager was started anew with it.");
    } else if (passwordWasRefused()) {
        daemon.start();
        context.say("RolvaneManager, which had ended because the password was refused, runs again and goes on.");
    }
    if (!formerUser.empty() && formerUser != account.user.str())
        context.say("The account's user is another one than before: the next pass starts from nothing and compares "
                    "everything.");
}

const char* sourceName(PasswordSource::Kind kind) {
    switch (kind) {
    case PasswordSource::Kind::none: return "none";
    case PasswordSource::Kind::command: return "command";
    case PasswordSource::Kind::credential: return "credential";
    case PasswordSource::Kind::file: return "file";
    }
    return "none";
}

void showAccount(Context& context) {
    const auto account = savedAccount();
    if (!account) throw noAccount();
    const char* authentication = account->authentication == Authentication::basic    ? "basic"
                                 : account->authentication == Authentication::digest ? "digest"
                                                                                     : "automatic";
    const Json data{
        {"user", account->user.str()},
        {"endpoint", account->endpoint},
        {"secureEndpoint", account->secureEndpoint},
        {"host", account->effectiveNameHost()},
        {"location", account->baseLocationFor(account->user).absoluteString()},
        {"authentication", authentication},
        {"password", {{"source", sourceName(account->passwordSource.kind)}, {"value", account->passwordSource.value}}},
        {"caFile", account->caFile},
        {"plainLoopback", account->plainLoopback}};
    if (context.json) return context.print(data);
    context.line(fmt::format("{:<15}{}", "User", account->user.str()));
    context.line(fmt::format("{:<15}{}", "Endpoint", account->endpoint));
    context.line(fmt::format("{:<15}{}", "Location", data["location"].get<std::string>()));
    context.line(fmt::format("{:<15}{}", "Sign-in", authentication));
    context.line(fmt::format("{:<15}{} {}", "Password", sourceName(account->passwordSource.kind),
                             account->passwordSource.value));
    if (!account->caFile.empty()) context.line(fmt::format("{:<15}{}", "Authority", account->caFile));
    if (account->plainLoopback) context.line(fmt::format("{:<15}{}", "Transport", "plain http on this machine"));
}

// Sentences for a usable store: each names an ability that it lacks, and the consequence.
std::vector<std::string> consequences(const StoreTrial& trial) {
    std::vector<std::string> lines;
    if (!trial.locks && trial.conditions)
        lines.emplace_back(
            "It keeps no locks: of two who change one file at once the second is told, and tries again.");
    if (!trial.locks && !trial.conditions)
        lines.emplace_back(
            "It keeps no locks and heeds no conditions: of two who change one file at once the later one "
            "wins. Publish from one machine at a time.");
    if (!trial.dates && trial.tags) lines.emplace_back("Its listings tell no dates: versions are told by their tags.");
    if (trial.dates && !trial.tags)
        lines.emplace_back("Its listings tell no tags: versions are told by date and size.");
    if (!trial.dates && !trial.tags)
        lines.emplace_back("Its listings tell neither dates nor tags: every pass reads everything.");
    if (!trial.accessLists)
        lines.emplace_back(
            "It keeps no access lists: who may read is the store's own matter, and `rolvane share` cannot "
            "change it.");
    return lines;
}

Json trialJson(const StoreTrial& trial) {
    return {{"usable", !trial.hindrance},
            {"hindrance", trial.hindrance ? Json(trial.hindrance->what) : Json()},
            {"dates", trial.dates},
            {"tags", trial.tags},
            {"locks", trial.locks},
            {"conditions", trial.conditions},
            {"accessLists", trial.accessLists}};
}

// Signs in, tries what a publication does, and looks whether the tree is there. Exit code 5 for a refused login or
// step, 6 for a store that is not reached, 1 for one that cannot be used.
void testAccount(Context& context) {
    const auto account = savedAccount();
    if (!account) throw noAccount();
    requirePassword(*account);
    const auto failure = testStore();
    const bool structure = !failure && CXDAVManager::defaultManager().sanityCheckPublishStructureCreate(false);
    const FailureScene scene = sceneOfTheAccount(Clock::system().now());
    const FailureText text = failure ? failureText(*failure, scene) : FailureText{kOk, {}, {}};
    const StoreTrial trial = failure ? StoreTrial() : tryStore(CXDAVManager::defaultManager());
    if (context.json)
        context.print({{"reachable", !failure},
                       {"code", failure ? failure->error : 0},
                       {"reason", failure ? Json(text.what) : Json()},
                       {"failure", failure ? failureJson(*failure, scene) : Json()},
                       {"published", structure},
                       {"trial", failure ? Json() : trialJson(trial)}});
    if (failure) throw CommandError(text.code, text.what + " " + text.toDo);
    if (trial.hindrance) throw hinderedBy(*trial.hindrance, "Nothing can be published there.");
    for (const std::string& line : consequences(trial)) context.say(line);
    context.say(structure ? "The store can be used, and the account's tree is there."
                          : "The store can be used; the account has no tree there yet.");
}

} // namespace

void addAccountCommands(CLI::App& app, Context& context) {
    CLI::App* account = addCommand(app, context, "account", "The account on the store", nullptr, nullptr);
    account->require_subcommand(1);
    const auto o = std::make_shared<AccountOptions>();
    CLI::App* set = addCommand(
        *account, context, "set", "Make or change the account; what is not given stays",
        [&](CLI::App& c) {
            c.add_option("--user", o->user, "User name on the store");
            c.add_option("--endpoint", o->endpoint,
                         "Where a user's tree is, such as https://dav.example.org/dav/{user}/Contacts");
            c.add_option("--secure-endpoint", o->secureEndpoint,
                         "The https endpoint of the same store, when --endpoint is plain http");
            c.add_option("--host", o->host, "Host in the names of locations; the endpoint's, unless given");
            c.add_option("--ca-file", o->caFile, "PEM file of a private certificate authority")->type_name(kFileValue);
            c.add_option("--authentication", o->authentication, "automatic, basic or digest")
                ->check(CLI::IsMember({"automatic", "basic", "digest"}));
            auto* password = c.add_option_group("password", "Where the password comes from; it is never an argument");
            password->add_flag("--ask-password", o->askPassword,
                               "Ask for it (or read a line of standard input) and keep it in a file of mode 0600");
            password->add_option("--password-command", o->passwordCommand, "Command whose first line of output it is");
            password->add_option("--password-credential", o->passwordCredential, "Name of a systemd credential");
            password->add_option("--password-file", o->passwordFile, "File of mode 0600")->type_name(kFileValue);
            password->add_flag("--no-password", o->noPassword, "The store asks for none");
            password->require_option(0, 1);
            c.add_flag("--plain-loopback,!--no-plain-loopback", o->plainLoopback,
                       "The store speaks plain http, on this machine only");
        },
        nullptr);
    set->final_callback([&context, o, set] { setAccount(context, *set, *o); });
    addCommand(*account, context, "show", "Show the account", nullptr, [&context] { showAccount(context); });
    addCommand(*account, context, "test", "Sign in to the store and try all that a publication needs of it", nullptr,
               [&context] { testAccount(context); });
}

} // namespace rolvane::cli
