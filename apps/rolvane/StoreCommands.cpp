#include "Consent.h"
#include "Context.h"
#include "Invite.h"
#include "Terminal.h"
#include "Texts.h"
#include "ValueNames.h"

#include "foundation/Paths.h"
#include "server/PrivateStore.h"
#include "server/StoreBackup.h"
#include "server/StoreConfiguration.h"
#include "server/StoreProcess.h"
#include "server/StoreSettings.h"
#include "store/account/CertificateChain.h"

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fmt/format.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

struct StoreOptions {
    std::string directory, root, authentication = "basic", user;
    int port = 0;
    bool noTLS = false, noHTTP2 = false, accessLog = false, now = false;
    bool invite = false, renew = false, qr = false, yes = false;
    std::string settings, inviter, file, quota, event;
    std::vector<std::string> eventWords;
    bool system = false;
    int keep = 0;
};

// The store of this machine ------------------------------------------------------------------------------------------

// The service manager's unit is the one that starts and stops it where there is one. An ordinary user's process, as
// the unit's own is, does it by itself.
bool isTheServiceManagers(const StoreOptions& options) {
    return options.system && geteuid() == 0 && access("/run/systemd/system", F_OK) == 0;
}

void askServiceManager(const char* verb) {
    std::string words[] = {"systemctl", verb, SystemStore::kUnit};
    char* arguments[] = {words[0].data(), words[1].data(), words[2].data(), nullptr};
    pid_t pid = 0;
    int status = 0;
    if (posix_spawnp(&pid, "systemctl", nullptr, nullptr, arguments, environ) != 0 || waitpid(pid, &status, 0) != pid ||
        status != 0)
        throw CommandError(kFailed, tr("`systemctl {} {}` failed. `journalctl -u {}` says why.", verb,
                                       SystemStore::kUnit, SystemStore::kUnit));
}

// From here on this process is one of the store's user, and so is everything that it writes or starts.
void becomeTheStoresUser(const StoreOptions& options, bool ports) {
    if (!options.system) return;
    const StoreIdentity identity = StoreIdentity::named(SystemStore::kUser);
    if (geteuid() == identity.uid) return;
    if (geteuid() != 0)
        throw CommandError(kRefused,
                           translated("The store of this machine is its administrator's. Type sudo in front of the "
                                      "command."));
    identity.takeOn(ports);
    setenv("HOME", SystemStore::kDirectory, 1);
    for (const char* name : {"XDG_CONFIG_HOME", "XDG_STATE_HOME", "XDG_DATA_HOME", "XDG_CACHE_HOME", "XDG_RUNTIME_DIR"})
        unsetenv(name);
}

std::string settingsOf(const StoreOptions& options) {
    return options.system ? SystemStore::kSettings : options.settings;
}

// The store as it was started last, so that later commands need only its directory.
PrivateStoreOptions knownOptions(const StoreOptions& options) {
    const std::string directory = options.system ? SystemStore::kDirectory : options.directory;
    if (auto saved = PrivateStore::savedOptions(directory)) return *saved;
    PrivateStoreOptions fresh;
    fresh.stateDirectory = directory;
    return fresh;
}

// The same with what the administrator has written since.
PrivateStoreOptions settledOptions(const StoreOptions& options) {
    const std::string settings = settingsOf(options);
    return settings.empty() ? knownOptions(options) : withStoreSettings(knownOptions(options), readFile(settings));
}

void tell(Context& context, const PrivateStore& store) {
    const PrivateStoreStatus status = store.status();
    const std::string shown = store.certificateFile();
    const bool isOwn = shown.empty() || std::filesystem::path(shown).parent_path() == store.stateDirectory() + "/tls";
    const std::string authority = isOwn && !shown.empty() ? store.caFile()
                                  : shown.empty()         ? translated("none yet")
                                                          : shown;
    const Json data{{"running", status.running},
                    {"process", status.running ? Json(status.pid) : Json()},
                    {"port", status.port ? Json(status.port) : Json()},
                    {"url", status.port ? Json(store.baseURL()) : Json()},
                    {"endpoint", status.port ? Json(store.endpointTemplate()) : Json()},
                    {"caFile", store.caFile()},
                    {"certificate", shown.empty() ? Json() : Json(shown)},
                    {"documents", store.documentRoot()},
                    {"errorLog", store.errorLog()},
                    {"users", store.users()}};
    if (context.json) return context.print(data);
    const auto row = [&](const char* label, const std::string& text) { context.row(label, text); };
    row(translated("Store"), status.running ? tr("running, process {}", status.pid) : translated("stopped"));
    if (status.port) row(translated("Endpoint"), store.endpointTemplate());
    row(translated("Authority"), authority);
    row(translated("Documents"), store.documentRoot());
    row(translated("Log"), store.errorLog());
    std::string users;
    for (const std::string& user : store.users()) users += (users.empty() ? "" : ", ") + user;
    row(translated("Users"), users.empty() ? translated("none (`rolvane store user add`)") : users);
}

void start(Context& context, CLI::App& command, const StoreOptions& options) {
    if (isTheServiceManagers(options)) {
        askServiceManager("start");
        becomeTheStoresUser(options, false);
        return tell(context, PrivateStore(knownOptions(options)));
    }
    becomeTheStoresUser(options, true);
    PrivateStoreOptions chosen = settledOptions(options);
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
    if (isTheServiceManagers(options)) return askServiceManager("stop");
    becomeTheStoresUser(options, false);
    PrivateStore store(knownOptions(options));
    const bool ran = store.status().running;
    store.stop(options.now ? PrivateStore::Stop::atOnce : PrivateStore::Stop::gracefully);
    context.say(ran ? translated("The store is stopped; its files stay.") : translated("The store was not running."));
}

// httpd's ACME module calls with what has happened; the one thing that matters is another certificate.
void reload(Context& context, const StoreOptions& options) {
    constexpr const char* kRenewed = "renewed";
    if (!options.eventWords.empty() && options.eventWords.front() != kRenewed) return;
    becomeTheStoresUser(options, false);
    if (!PrivateStore(settledOptions(options)).reload())
        throw CommandError(kNotFound, translated("The store does not run. `rolvane store start` starts it."));
    context.say(translated("The store has taken its settings and certificates in."));
}

void backup(Context& context, const StoreOptions& options) {
    becomeTheStoresUser(options, false);
    const StoreBackup backup(knownOptions(options));
    std::error_code error;
    std::string file = options.file;
    if (std::filesystem::is_directory(file, error))
        file = backup.writeInto(file, options.keep);
    else if (options.keep > 0)
        throw CommandError(kUsage,
                           translated("--keep needs a directory, where the backups have names with their dates."));
    else
        backup.write(file);
    context.say(tr("The store is in {}, with everything that signs its users in: keep it where nobody else "
                   "reads it.",
                   file == "-" ? translated("what was written") : file));
}

void restoreBackup(Context& context, const StoreOptions& options) {
    becomeTheStoresUser(options, false);
    const PrivateStoreOptions known = knownOptions(options);
    CXPathUtils_MakeCompletePath(PrivateStore(known).stateDirectory() + "/conf", 0700);
    requireConsent(context, options.yes,
                   tr("Put the store of {} in the place of the one that is here, with {}?", options.file,
                      countedText(PrivateStore(known).users().size(), "user", "users")),
                   translated("Nothing was changed."));
    const std::string former = StoreBackup(known).restore(options.file);
    context.say(tr("The store of the backup is here. What was here before is in {}.", former));
}

void quota(Context& context, const StoreOptions& options) {
    becomeTheStoresUser(options, false);
    PrivateStore store(knownOptions(options));
    const std::vector<std::string> users = store.users();
    const bool isKnown = std::find(users.begin(), users.end(), options.user) != users.end();
    if (!options.user.empty() && !isKnown) throw CommandError(kNotFound, tr("The store has no user {}.", options.user));
    if (!options.quota.empty()) {
        if (options.quota != "default" && !isQuota(options.quota))
            throw CommandError(kUsage, tr("\"{}\" is no quota: write 500M, 2G, none, or default.", options.quota));
        if (store.roomOf(options.user).quota.empty())
            throw CommandError(kFailed,
                               translated("This store keeps no quotas. A line such as `quota = 1G` in its settings and "
                                          "`rolvane store reload` begin with it."));
        store.setQuota(options.user, options.quota == "default" ? "" : options.quota);
    }
    Json all = Json::array();
    for (const std::string& user : users) {
        if (!options.user.empty() && user != options.user) continue;
        const PrivateStore::Room room = store.roomOf(user);
        all.push_back({{"user", user},
                       {"used", room.used ? Json(*room.used) : Json()},
                       {"quota", room.quota.empty() ? "none" : room.quota},
                       {"own", room.isOwn}});
    }
    if (context.json) return context.print(all);
    for (const Json& row : all) {
        constexpr double kMega = 1 << 20;
        const std::string used = row["used"].is_null() ? translated("not counted yet")
                                                       : fmt::format("{:.1f}M", row["used"].get<double>() / kMega);
        context.line(tr("{:<20} {:>15} of {}{}", row["user"].get<std::string>(), used, row["quota"].get<std::string>(),
                        row["own"].get<bool>() ? translated(" (own)") : ""));
    }
}

std::string newPassword(const std::string& user) {
    const std::string password = readSecret(tr("New password of {}: ", user));
    if (password.empty()) throw CommandError(kUsage, translated("The password is empty. Nothing was changed."));
    return password;
}

// The store has to show its authority to whoever is to find it by its fingerprint.
void requireShownAuthority(const PrivateStore& store, const std::string& fingerprint) {
    if (!store.status().running)
        throw CommandError(kFailed,
                           translated("The store does not run. `rolvane store start` starts it; then invite again."));
    if (!fingerprint.empty() && !withFingerprint(certificatesShownAt(Url(store.localURL())), fingerprint))
        throw CommandError(
            kFailed, translated("The store was started by an earlier version and does not show its authority yet. "
                                "`rolvane store stop && rolvane store start`, then invite again."));
}

void invite(Context& context, const StoreOptions& options) {
    PrivateStore store(knownOptions(options));
    const std::vector<std::string> users = store.users();
    if (!options.renew && std::find(users.begin(), users.end(), options.user) != users.end())
        throw CommandError(kRefused, tr("There is a user {0} already. `--renew` gives {0} a new first password, "
                                        "and the one that {0} has ends.",
                                        options.user));
    Invitation invitation;
    invitation.endpoint = store.endpointTemplate();
    if (!invitation.endpoint.starts_with("https:"))
        throw CommandError(kFailed,
                           translated("The store speaks plain http, and an invitation holds a password. Start it with "
                                      "TLS."));
    invitation.user = options.user;
    invitation.fingerprint = store.authorityFingerprint();
    requireShownAuthority(store, invitation.fingerprint);
    invitation.password = makePassword();
    invitation.passwordPath = storePasswordPath(knownOptions(options), options.user);
    invitation.inviter = !options.inviter.empty() || options.system ? options.inviter : inviterOn(invitation.endpoint);
    if (!invitation.inviter.empty() && !options.inviter.empty() &&
        std::find(users.begin(), users.end(), options.inviter) == users.end())
        throw CommandError(kNotFound, tr("The store has no user {}.", options.inviter));
    store.addUser(options.user, invitation.password);
    printInvitation(context, invitation, options.qr);
}

void addUser(Context& context, const StoreOptions& options) {
    becomeTheStoresUser(options, false);
    if (options.invite) return invite(context, options);
    PrivateStore known(knownOptions(options));
    known.addUser(options.user, newPassword(options.user));
    context.say(tr("{} can sign in.", options.user));
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
    becomeTheStoresUser(options, false);
    PrivateStore store(knownOptions(options));
    const std::vector<std::string> users = store.users();
    const auto unknown = [&] { return CommandError(kNotFound, tr("The store has no user {}.", options.user)); };
    if (std::find(users.begin(), users.end(), options.user) == users.end()) throw unknown();
    const std::string directory = store.userDirectory(options.user);
    requireConsent(context, options.yes,
                   tr("Take the account of {} away? {} of it stay in {}, and nobody signs in as {} any more.",
                      options.user, countedText(filesBelow(directory), "file", "files"), directory, options.user),
                   translated("The account stays."));
    if (!store.removeUser(options.user)) throw unknown();
    context.say(tr("{} can no longer sign in.", options.user));
}

} // namespace

void addStoreCommands(CLI::App& app, Context& context) {
    CLI::App* store = addCommand(app, context, "store", "A store on this machine", nullptr, nullptr);
    store->require_subcommand(1);
    const auto o = std::make_shared<StoreOptions>();
    const auto directory = [o](CLI::App& c) {
        auto* place =
            c.add_option("--directory", o->directory, "The store's own directory; several stores have one each")
                ->type_name(kDirectoryValue);
        c.add_flag("--system", o->system,
                   "The store for several households that the package rolvane-store keeps (as its administrator)")
            ->excludes(place);
    };
    const auto settings = [o](CLI::App& c) {
        c.add_option("--settings", o->settings, "A file of settings, such as /etc/rolvane-store/store.conf")
            ->type_name(kFileValue)
            ->excludes(c.get_option("--system"));
    };
    CLI::App* startCommand = addCommand(
        *store, context, "start", "Start it on a free loopback port; returns when it answers",
        [&](CLI::App& c) {
            directory(c);
            settings(c);
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
                   becomeTheStoresUser(*o, false);
                   const PrivateStore known(knownOptions(*o));
                   tell(context, known);
                   if (!known.status().running) context.exitCode = kNotFound;
               });
    addCommand(
        *store, context, "reload", "Take settings and certificates in, and open the logs again, while requests go on",
        [&](CLI::App& c) {
            directory(c);
            settings(c);
            c.add_option("--event", o->eventWords)->group("");
        },
        [&context, o] { reload(context, *o); });
    addCommand(
        *store, context, "backup", "Write the trees, lists and users to a file; the store may run",
        [&](CLI::App& c) {
            directory(c);
            c.add_option("file", o->file, "A file, a directory for one with today's date, or - for standard output")
                ->required()
                ->type_name(kFileValue);
            c.add_option("--keep", o->keep, "In a directory: remove all but the youngest so many");
        },
        [&context, o] { backup(context, *o); });
    addCommand(
        *store, context, "restore", "Bring back what `store backup` wrote; the store has to be stopped",
        [&](CLI::App& c) {
            directory(c);
            c.add_option("file", o->file, "The file, or - for standard input")->required()->type_name(kFileValue);
            declareConsent(c, o->yes);
        },
        [&context, o] { restoreBackup(context, *o); });
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
            c.add_option("--inviter", o->inviter,
                         "Whose contacts `rolvane setup` offers; yours where you have an account")
                ->type_name(kStoreUserValue)
                ->needs(invites);
        },
        [&context, o] { addUser(context, *o); });
    addCommand(
        *user, context, "remove", "Take a user's account away; the files stay",
        [named, o](CLI::App& c) {
            named(c);
            declareConsent(c, o->yes);
        },
        [&context, o] { removeUser(context, *o); });
    addCommand(
        *user, context, "quota", "Tell how much room users take, or set how much one may take",
        [&](CLI::App& c) {
            directory(c);
            c.add_option("user", o->user, "User name; all without one")->type_name(kStoreUserValue);
            c.add_option("size", o->quota, "500M, 2G, none, or default for that of everybody");
        },
        [&context, o] { quota(context, *o); });
    addCommand(*user, context, "list", "List the users", directory, [&context, o] {
        becomeTheStoresUser(*o, false);
        const std::vector<std::string> users = PrivateStore(knownOptions(*o)).users();
        if (context.json) return context.print(Json(users));
        for (const std::string& name : users) context.line(name);
    });
}

} // namespace rolvane::cli
