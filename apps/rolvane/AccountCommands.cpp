#include "AccountTrial.h"
#include "Context.h"
#include "FailureText.h"
#include "Terminal.h"
#include "Texts.h"
#include "ValueNames.h"

#include "store/dav/CXDAVManager.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

struct AccountOptions {
    std::string user, endpoint, secureEndpoint, host, caFile, authentication = "automatic";
    std::string passwordCommand, passwordCredential, passwordFile;
    bool keyring = false, askPassword = false, noPassword = false, plainLoopback = false, store = false;
};

Authentication authenticationNamed(const std::string& name) {
    return name == "basic"    ? Authentication::basic
           : name == "digest" ? Authentication::digest
                              : Authentication::automatic;
}

PasswordSource passwordSource(const AccountOptions& options, const CXDAVAccount& account) {
    const PasswordSource& former = account.passwordSource;
    const UserName& user = account.user;
    using Kind = PasswordSource::Kind;
    if (options.noPassword) return {Kind::none, {}};
    if (!options.passwordCommand.empty()) return {Kind::command, options.passwordCommand};
    if (!options.passwordCredential.empty()) return {Kind::credential, options.passwordCredential};
    if (!options.passwordFile.empty()) return {Kind::file, absolutePath(options.passwordFile)};
    if (!options.askPassword && !options.keyring) return former;
    const std::string password = readSecret(tr("Password of {}: ", user.str()));
    if (password.empty()) throw CommandError(kUsage, translated("The password is empty. Nothing was changed."));
    if (options.keyring) return keptInKeyring(account, password);
    return keptInFile(password);
}

std::optional<CXDAVAccount> savedAccount() {
    return CXDAVAccount::load();
}

void setAccount(Context& context, CLI::App& command, const AccountOptions& options) {
    const auto given = [&](const char* option) { return command.get_option(option)->count() > 0; };
    CXDAVAccount account;
    try {
        if (const auto saved = savedAccount()) account = *saved;
    } catch (const CXException& error) { // one that cannot be used is replaced by a whole new one only
        if (!given("--user") || !given("--endpoint"))
            throw CommandError(kFailed,
                               error.reason() + translated(" Make the account anew: give --user and --endpoint."));
    }
    const std::string formerUser = account.user.str();
    if (given("--user")) account.user = UserName(options.user);
    if (given("--endpoint")) account.endpoint = options.endpoint;
    if (given("--secure-endpoint")) account.secureEndpoint = options.secureEndpoint;
    if (given("--host")) account.nameHost = options.host;
    if (given("--ca-file")) account.caFile = absolutePath(options.caFile);
    if (given("--authentication")) account.authentication = authenticationNamed(options.authentication);
    if (given("--plain-loopback")) account.plainLoopback = options.plainLoopback;
    if (account.user.empty()) throw CommandError(kUsage, translated("Name the user with --user."));
    if (const auto problem = account.problem()) throw CommandError(kUsage, *problem);
    account.passwordSource = passwordSource(options, account);
    if (const auto problem = account.problem()) throw CommandError(kUsage, *problem);
    if (given("--password-file")) requirePassword(account); // a file that cannot be used is better told now
    account.save();
    context.say(
        tr("The account of {} at {} is saved. `rolvane account test` tries it.", account.user.str(), account.endpoint));
    accountWasSaved(context);
    if (!formerUser.empty() && formerUser != account.user.str())
        context.say(
            translated("The account's user is another one than before: the next pass starts from nothing and compares "
                       "everything."));
}

const char* sourceName(PasswordSource::Kind kind) {
    switch (kind) {
    case PasswordSource::Kind::none: return "none";
    case PasswordSource::Kind::command: return "command";
    case PasswordSource::Kind::credential: return "credential";
    case PasswordSource::Kind::file: return "file";
    case PasswordSource::Kind::keyring: return "keyring";
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
    context.row(translated("User"), account->user.str());
    context.row(translated("Endpoint"), account->endpoint);
    context.row(translated("Location"), data["location"].get<std::string>());
    context.row(translated("Sign-in"), authentication);
    context.row(translated("Password"),
                fmt::format("{} {}", sourceName(account->passwordSource.kind), account->passwordSource.value));
    if (!account->caFile.empty()) context.row(translated("Authority"), account->caFile);
    if (account->plainLoopback) context.row(translated("Transport"), translated("plain http on this machine"));
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
    if (trial.hindrance) throw hinderedBy(*trial.hindrance, translated("Nothing can be published there."));
    for (const std::string& line : consequences(trial)) context.say(line);
    context.say(structure ? translated("The store can be used, and the account's tree is there.")
                          : translated("The store can be used; the account has no tree there yet."));
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
            password->add_flag("--keyring", o->keyring,
                               "Ask for it (or read a line of standard input) and keep it in the keyring");
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
