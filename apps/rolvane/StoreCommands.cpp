#include "Consent.h"
#include "Context.h"
#include "Counted.h"
#include "Invite.h"
#include "Terminal.h"
#include "ValueNames.h"

#include "foundation/Paths.h"
#include "server/PrivateStore.h"
#include "server/StoreConfiguration.h"
#include "store/account/CertificateChain.h"

#include <algorithm>
#include <filesystem>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

struct StoreOptions {
    std::string directory, root, authentication = "basic", user;
    int port = 0;
    bool noTLS = false, noHTTP2 = false, accessLog = false, now = false;
    bool invite = false, renew = false, qr = false, yes = false;
};

// The store as it was started last, so that later commands need only its directory.
PrivateStoreOptions knownOptions(const StoreOptions& options) {
    if (auto saved = PrivateStore::savedOptions(options.directory)) return *saved;
    PrivateStoreOptions fresh;
    fresh.stateDirectory = options.directory;
    return fresh;
}

void tell(Context& context, const PrivateStore& store) {
    const PrivateStoreStatus status = store.status();
    const Json data{{"running", status.running},
                    {"process", status.running ? Json(status.pid) : Json()},
                    {"port", status.port ? Json(status.port) : Json()},
                    {"url", status.port ? Json(store.baseURL()) : Json()},
                    {"endpoint", status.port ? Json(store.endpointTemplate()) : Json()},
                    {"caFile", store.caFile()},
                    {"documents", store.documentRoot()},
                    {"errorLog", store.errorLog()},
                    {"users", store.users()}};
    if (context.json) return context.print(data);
    const auto row = [&](const char* label, const std::string& text) {
        context.line(fmt::format("{:<15}{}", label, text));
    };
    row("Store", status.running ? fmt::format("running, process {}", status.pid) : "stopped");
    if (status.port) row("Endpoint", store.endpointTemplate());
    row("Authority", store.caFile());
    row("Documents", store.documentRoot());
    row("Log", store.errorLog());
    std::string users;
    for (const std::string& user : store.users()) users += (users.empty() ? "" : ", ") + user;
    row("Users", users.empty() ? "none (`rolvane store user add`)" : users);
}

void start(Context& context, CLI::App& command, const StoreOptions& options) {
    PrivateStoreOptions chosen = knownOptions(options);
    const auto given = [&](const char* option) { return command.get_option(option)->count() > 0; };
    if (given("--root")) chosen.documentRoot = options.root;
    if (given("--port")) chosen.port = options.port;
    if (given("--no-tls")) chosen.tls = !options.noTLS;
    if (given("--no-http2")) chosen.http2 = !options.noHTTP2;
    if (given("--access-log")) chosen.accessLog = options.accessLog;
    if (given("--authentication"))
        chosen.authentication = options.authentication == "digest" ? StoreAuthentication::digest
                                : options.authentication == "none" ? StoreAuthentication::none
                                                                   : StoreAuthentication::basic;
    PrivateStore store(chosen);
    store.start();
    tell(context, store);
}

void stop(Context& context, const StoreOptions& options) {
    PrivateStore store(knownOptions(options));
    const bool ran = store.status().running;
    store.stop(options.now ? PrivateStore::Stop::atOnce : PrivateStore::Stop::gracefully);
    context.say(ran ? "The store is stopped; its files stay." : "The store was not running.");
}

std::string newPassword(const std::string& user) {
    const std::string password = readSecret("New password of " + user + ": ");
    if (password.empty()) throw CommandError(kUsage, "The password is empty. Nothing was changed.");
    return password;
}

// The store has to show its authority to whoever is to find it by its fingerprint.
void requireShownAuthority(const PrivateStore& store, const std::string& fingerprint) {
    if (!store.status().running)
        throw CommandError(kFailed, "The store does not run. `rolvane store start` starts it; then invite again.");
    if (!withFingerprint(certificatesShownAt(Url(store.baseURL())), fingerprint))
        throw CommandError(kFailed, "The store was started by an earlier version and does not show its authority yet. "
                                    "`rolvane store stop && rolvane store start`, then invite again.");
}

void invite(Context& context, const StoreOptions& options) {
    PrivateStore store(knownOptions(options));
    const std::vector<std::string> users = store.users();
    if (!options.renew && std::find(users.begin(), users.end(), options.user) != users.end())
        throw CommandError(kRefused,
                           fmt::format("There is a user {0} already. `--renew` gives {0} a new first password, "
                                       "and the one that {0} has ends.",
                                       options.user));
    Invitation invitation;
    invitation.endpoint = store.endpointTemplate();
    if (!invitation.endpoint.starts_with("https:"))
        throw CommandError(kFailed, "The store speaks plain http, and an invitation holds a password. Start it with "
                                    "TLS.");
    invitation.user = options.user;
    const auto authority = certificatesIn(readFile(store.caFile()));
    if (authority.empty())
        throw CommandError(kFailed, fmt::format("The authority's file {} holds no certificate. `rolvane store stop && "
                                                "rolvane store start` makes another one.",
                                                store.caFile()));
    invitation.fingerprint = authority.front().fingerprint;
    requireShownAuthority(store, invitation.fingerprint);
    invitation.password = makePassword();
    invitation.passwordPath = storePasswordPath(knownOptions(options), options.user);
    invitation.inviter = inviterOn(invitation.endpoint);
    store.addUser(options.user, invitation.password);
    printInvitation(context, invitation, options.qr);
}

void addUser(Context& context, const StoreOptions& options) {
    if (options.invite) return invite(context, options);
    PrivateStore known(knownOptions(options));
    known.addUser(options.user, newPassword(options.user));
    context.say(fmt::format("{} can sign in.", options.user));
}

size_t filesBelow(const std::string& directory) {
    size_t files = 0;
    std::error_code error;
    for (std::filesystem::recursive_directory_iterator each(directory, error), end; !error && each != end;
         each.increment(error))
        files += each->is_regular_file() && each->path().parent_path().filename() != ".DAV";
    return files;
}

void removeUser(Context& context, const StoreOptions& options) {
    PrivateStore store(knownOptions(options));
    const std::vector<std::string> users = store.users();
    const auto unknown = [&] {
        return CommandError(kNotFound, fmt::format("The store has no user {}.", options.user));
    };
    if (std::find(users.begin(), users.end(), options.user) == users.end()) throw unknown();
    const std::string directory = store.userDirectory(options.user);
    requireConsent(context, options.yes,
                   fmt::format("Take the account of {} away? {} of it stay in {}, and nobody signs in as {} any more.",
                               options.user, counted(filesBelow(directory), "file", "files"), directory, options.user),
                   "The account stays.");
    if (!store.removeUser(options.user)) throw unknown();
    context.say(fmt::format("{} can no longer sign in.", options.user));
}

} // namespace

void addStoreCommands(CLI::App& app, Context& context) {
    CLI::App* store = addCommand(app, context, "store", "A private store on this machine", nullptr, nullptr);
    store->require_subcommand(1);
    const auto o = std::make_shared<StoreOptions>();
    const auto directory = [o](CLI::App& c) {
        c.add_option("--directory", o->directory, "The store's own directory; several stores have one each")
            ->type_name(kDirectoryValue);
    };
    CLI::App* startCommand = addCommand(
        *store, context, "start", "Start it on a free loopback port; returns when it answers",
        [&](CLI::App& c) {
            directory(c);
            c.add_option("--root", o->root, "Where the published files lie")->type_name(kDirectoryValue);
            c.add_option("--port", o->port, "Port; the one of the last start, else a free one");
            c.add_option("--authentication", o->authentication,
                         "basic, digest (keeps what is as good as the passwords) or none")
                ->check(CLI::IsMember({"basic", "digest", "none"}));
            c.add_flag("--no-tls", o->noTLS, "Plain http");
            c.add_flag("--access-log,!--no-access-log", o->accessLog,
                       "Write a line for every request to logs/access.log");
            c.add_flag("--no-http2", o->noHTTP2, "HTTP/1.1 only");
        },
        nullptr);
    startCommand->final_callback([&context, o, startCommand] { start(context, *startCommand, *o); });
    addCommand(
        *store, context, "stop", "Stop it; the files stay",
        [&](CLI::App& c) {
            directory(c);
            c.add_flag("--now", o->now, "Do not wait for requests under way");
        },
        [&context, o] { stop(context, *o); });
    addCommand(*store, context, "status", "Tell whether it runs, and where (exit code 0 or 3)", directory,
               [&context, o] {
                   const PrivateStore known(knownOptions(*o));
                   tell(context, known);
                   if (!known.status().running) context.exitCode = kNotFound;
               });
    CLI::App* user = addCommand(*store, context, "user", "Users of the store", nullptr, nullptr);
    user->require_subcommand(1);
    const auto named = [&, directory, o](CLI::App& c) {
        directory(c);
        c.add_option("user", o->user, "User name")->required()->type_name(kStoreUserValue);
    };
    addCommand(
        *user, context, "add", "Add a user, or set a new password (asked for, or a line of standard input)",
        [&](CLI::App& c) {
            named(c);
            auto* invites =
                c.add_flag("--invite", o->invite, "Make the first password, and print one line for `rolvane setup`");
            c.add_flag("--renew", o->renew, "Invite a user who is there; the password of before ends")->needs(invites);
            c.add_flag("--qr", o->qr, "Show the line as a QR code, too")->needs(invites);
        },
        [&context, o] { addUser(context, *o); });
    addCommand(
        *user, context, "remove", "Take a user's account away; the files stay",
        [named, o](CLI::App& c) {
            named(c);
            declareConsent(c, o->yes);
        },
        [&context, o] { removeUser(context, *o); });
    addCommand(*user, context, "list", "List the users", directory, [&context, o] {
        const std::vector<std::string> users = PrivateStore(knownOptions(*o)).users();
        if (context.json) return context.print(Json(users));
        for (const std::string& name : users) context.line(name);
    });
}

} // namespace rolvane::cli
