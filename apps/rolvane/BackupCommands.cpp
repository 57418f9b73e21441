#include "BackupCommands.h"

#include "Backup.h"
#include "Books.h"
#include "Consent.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include "daemon/DaemonControl.h"
#include "daemon/InstanceLock.h"
#include "foundation/Paths.h"
#include "store/account/Account.h"

#include <filesystem>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;
namespace fs = std::filesystem;

struct Options {
    std::string file;
    bool yes = false, dryRun = false;
};

Json factsJson(const std::string& file, const BackupFacts& facts) {
    return {{"file", file},
            {"bytes", facts.bytes},
            {"date", facts.date.toISO8601()},
            {"computer", facts.computer},
            {"version", facts.version},
            {"people", facts.people},
            {"groups", facts.groups},
            {"account", facts.user.empty() ? Json() : Json(facts.user)},
            {"preferences", facts.hasPreferences},
            {"withdrawnFiles", facts.withdrawn}};
}

// "318 people, 6 groups, the account of alice and the preferences".
std::string contentsText(const BackupFacts& facts) {
    std::vector<std::string> parts;
    if (facts.hasDatabase) {
        parts.push_back(countedText(facts.people, "person", "people"));
        parts.push_back(countedText(facts.groups, "group", "groups"));
    }
    if (!facts.user.empty()) parts.push_back(tr("the account of {}", facts.user));
    if (facts.hasPreferences) parts.emplace_back(translated("the preferences"));
    if (facts.withdrawn > 0) parts.emplace_back(translated("what publishers have withdrawn"));
    if (parts.empty()) return translated("nothing");
    std::string text;
    for (size_t i = 0; i < parts.size(); ++i)
        text += (i == 0 ? "" : i + 1 == parts.size() ? translated(" and ") : ", ") + parts[i];
    return text;
}

void backUp(Context& context, const Options& options) {
    std::error_code error;
    const std::string file = fs::absolute(options.file);
    if (fs::is_directory(file, error))
        throw CommandError(
            kUsage, tr("{} is a directory. Name the file, such as {}/contacts.rolvane.", options.file, options.file));
    if (fs::exists(file, error))
        requireConsent(context, options.yes, tr("Replace the file {}?", options.file),
                       translated("It stays as it is, and nothing was backed up."));
    std::vector<std::string> left;
    const BackupFacts facts = writeBackup(file, left);
    for (const std::string& each : left) context.warn(each);
    if (context.json) context.print(factsJson(options.file, facts));
    context.say(tr("{} holds {}. It was read back, and it is whole. Passwords are not in it.", options.file,
                   contentsText(facts)));
    if (!left.empty()) context.exitCode = kPartly;
}

// Switches the address books off while it lives.
class BooksRest {
public:
    BooksRest() : _server(knownBooks()), _wereOn(_server.status().on) {
        if (_wereOn) _server.off();
    }
    void end() {
        if (_wereOn) _server.on();
        _wereOn = false;
    }

private:
    BooksServer _server;
    bool _wereOn;
};

// Nobody else starts a daemon while the files are exchanged.
void exchange(Backup& backup) {
    const auto lock = InstanceLock::acquire(InstanceLock::defaultPath());
    if (!lock)
        throw CommandError(kFailed,
                           translated("RolvaneManager was started meanwhile. Nothing was restored; try again."));
    backup.restore();
}

void tellNext(Context& context) {
    const auto account = CXDAVAccount::load();
    if (!account) return;
    try {
        (void)account->password();
    } catch (const CXException&) {
        const bool keyring = account->passwordSource.kind == PasswordSource::Kind::keyring;
        context.say(tr(
            "The password of {} is in no backup: give it with `rolvane account set {}`, then `rolvane daemon start`.",
            account->user.str(), keyring ? "--keyring" : "--ask-password"));
        return;
    }
    context.say(
        translated("`rolvane doctor` looks at everything that sharing needs; `rolvane daemon start` goes on with it."));
}

void restore(Context& context, const Options& options) {
    Backup backup(options.file);
    const BackupFacts& facts = backup.facts();
    const std::string here = whatIsHere(), held = contentsText(facts);
    const std::string made = facts.computer.empty()
                                 ? tr("of {}", shownDate(facts.date))
                                 : tr("of {} from the computer {}", shownDate(facts.date), facts.computer);
    if (options.dryRun) {
        if (context.json) {
            Json data = factsJson(options.file, facts);
            data["replaces"] = here.empty() ? Json() : Json(here);
            return context.print(data);
        }
        context.line(tr("{} is whole, {}. It holds {}.", options.file, made, held));
        return context.line(here.empty() ? translated("There is nothing here that it would replace.")
                                         : tr("It would replace {}.", here));
    }
    if (!here.empty())
        requireConsent(context, options.yes, tr("Replace {} by the backup {}, with {}?", here, made, held),
                       translated("Nothing was restored."));
    const bool daemonRan = DaemonControl().stop();
    BooksRest books;
    const std::string kept = here.empty() ? "" : keepWhatIsHere(Clock::system().now());
    exchange(backup);
    books.end();
    if (context.json) {
        Json data = factsJson(options.file, facts);
        data["kept"] = kept.empty() ? Json() : Json(kept);
        context.print(data);
    }
    context.say(tr("Restored: {}.", held));
    if (!kept.empty())
        context.say(tr("What was here before is kept in {}{}", kept,
                       kept.ends_with(".rolvane") ? tr("; `rolvane restore {}` brings it back.", kept) : "."));
    if (daemonRan) DaemonControl().start();
    tellNext(context);
}

} // namespace

void addBackupCommands(CLI::App& app, Context& context) {
    const auto o = std::make_shared<Options>();
    addCommand(
        app, context, "backup", "Write contacts, account and preferences to one file, without any password",
        [o](CLI::App& c) {
            c.add_option("file", o->file, "The file; one that is there is replaced on request")
                ->required()
                ->type_name(kFileValue);
            declareConsent(c, o->yes);
        },
        [&context, o] { backUp(context, *o); });
    addCommand(
        app, context, "restore", "Bring back what a backup holds; what it replaces is kept",
        [o](CLI::App& c) {
            c.add_option("file", o->file, "A file that `rolvane backup` has written")
                ->required()
                ->type_name(kFileValue);
            c.add_flag("--dry-run", o->dryRun, "Only tell whether the file is whole and what it holds");
            declareConsent(c, o->yes);
        },
        [&context, o] { restore(context, *o); });
}

} // namespace rolvane::cli
