#include "Books.h"
#include "BooksLink.h"
#include "Lookup.h"
#include "Terminal.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/records/Identifier.h"
#include "foundation/Paths.h"
#include "server/UnitConfinement.h"
#include "server/UserUnits.h"

#include <filesystem>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

constexpr const char* kService = "rolvane-books-link.service";
constexpr const char* kTimer = "rolvane-books-link.timer";

struct LinkOptions {
    std::string url, user, passwordCommand, group, caFile;
    std::vector<std::string> cards;
};

std::string ownProgram() {
    std::error_code error;
    return std::filesystem::read_symlink("/proc/self/exe", error).string();
}

std::map<std::string, std::string> timerUnits() {
    return {{kService, fmt::format("[Unit]\nDescription=Rolvane: brings linked address books in step\n"
                                   "Documentation=man:rolvane(1)\n\n[Service]\nType=oneshot\n"
                                   "ExecStart=\"{}\" books sync --quiet\n{}",
                                   ownProgram(), unitConfinement({"%h", "%t"}))},
            {kTimer, "[Unit]\nDescription=Rolvane: brings linked address books in step every five minutes\n"
                     "Documentation=man:rolvane(1)\n\n[Timer]\nOnStartupSec=1min\nOnUnitActiveSec=5min\n"
                     "AccuracySec=30s\n\n[Install]\nWantedBy=timers.target\n"}};
}

// Which book a group's name, or none, means.
void chooseBook(Context& context, const std::string& group, BooksLink::Settings& settings) {
    settings.book = "contacts";
    settings.name = "Contacts";
    if (group.empty()) return;
    const CXGroupRef found = findGroup(context.database(), group);
    if (found->isSubscribed())
        throw CommandError(kRefused,
                           tr("{} is a copy of somebody else's group. Link a group of your own.", found->name()));
    settings.book = "group-" + std::string(cxUUIDPart(found->uniqueId()));
    settings.name = found->name();
}

void requireGood(const BooksLink& link, const BooksLink::Outcome& outcome) {
    if (!outcome.good)
        throw CommandError(kFailed, tr("{} could not be brought in step with {}: {} The log is {}.",
                                       link.settings().name, link.settings().url, outcome.message, link.logFile()));
}

void link(Context& context, const LinkOptions& options) {
    const BooksOptions books = knownBooks();
    const BooksServer server(books);
    if (!server.status().on)
        throw CommandError(
            kFailed, translated("The address books are off. `rolvane books on` switches them on; then link again."));
    BooksLink::Settings settings{.book = {},
                                 .name = {},
                                 .url = options.url,
                                 .user = options.user,
                                 .passwordCommand = options.passwordCommand,
                                 .caFile = options.caFile};
    chooseBook(context, options.group, settings);
    if (!settings.url.starts_with("https://") && !settings.url.starts_with("http://"))
        throw CommandError(kUsage, tr("\"{}\" is no address of an address book: it begins with https:// (or "
                                      "http://). The program or page that shows the other address book "
                                      "tells it.",
                                      settings.url));
    if (!settings.url.ends_with("/")) settings.url += '/';
    if (const auto there = BooksLink::of(books, settings.book))
        throw CommandError(kUsage,
                           tr("{} is linked with {} already. `rolvane books unlink{}` ends that.", settings.name,
                              there->settings().url, options.group.empty() ? "" : " --group " + options.group));
    std::string password;
    if (!settings.user.empty() && settings.passwordCommand.empty())
        password = readSecret(tr("Password of {} there: ", settings.user));
    const BooksLink made = BooksLink::make(books, settings, password);
    const BooksLink::Outcome outcome = made.run();
    if (!outcome.good) {
        const std::string log = made.logFile();
        made.remove();
        throw CommandError(kFailed, tr("{} could not be brought in step with {}: {} Nothing was linked.", settings.name,
                                       settings.url, outcome.message));
    }
    context.say(tr("{} is in step with {}.", settings.name, settings.url));
    if (!UserUnits::available()) {
        context.say(tr("There is no service manager here that would keep it so: run `{} books sync` now and "
                       "then, for instance every five minutes by cron.",
                       ownProgram()));
        return;
    }
    UserUnits::install(timerUnits());
    UserUnits::enable(kTimer);
    context.say(translated("It is kept so every five minutes."));
}

void unlink(Context& context, const LinkOptions& options) {
    const BooksOptions books = knownBooks();
    BooksLink::Settings named;
    try {
        chooseBook(context, options.group, named);
    } catch (const CommandError&) {
        // The group is gone; its link may be there.
        for (const BooksLink& each : BooksLink::all(books))
            if (each.settings().name == options.group) named = each.settings();
        if (named.name != options.group) throw;
    }
    const auto found = BooksLink::of(books, named.book);
    if (!found) throw CommandError(kNotFound, tr("{} is linked with nothing.", named.name));
    found->remove();
    if (BooksLink::all(books).empty()) UserUnits::remove({kTimer, kService});
    context.say(tr("{} is no longer kept in step with {}; both stay as they are.", named.name, found->settings().url));
}

void syncAll(Context& context) {
    const std::vector<BooksLink> links = BooksLink::all(knownBooks());
    if (links.empty())
        throw CommandError(kNotFound, translated("No address book is linked. `rolvane books link URL` links one."));
    std::vector<std::pair<const BooksLink*, BooksLink::Outcome>> failed;
    for (const BooksLink& each : links) {
        const BooksLink::Outcome outcome = each.run();
        if (outcome.good)
            context.say(tr("{} is in step with {}.", each.settings().name, each.settings().url));
        else
            failed.emplace_back(&each, outcome);
    }
    for (const auto& [each, outcome] : failed) {
        if (each != failed.back().first)
            context.warn(tr("rolvane: {} could not be brought in step: {}", each->settings().name, outcome.message));
        else
            requireGood(*each, outcome);
    }
}

// vdirsyncer calls this with the two versions of a card that both sides have changed, and wants two equal files.
void mergeCards(const LinkOptions& options) {
    const std::string merged = mergedCards(readFile(options.cards.at(0)), readFile(options.cards.at(1)));
    if (merged.empty()) throw CommandError(kFailed, translated("The two files are not two cards of one contact."));
    for (const std::string& file : options.cards) writeFileWhole(file, merged);
}

} // namespace

Json linksJson(const BooksOptions& books) {
    Json all = Json::array();
    for (const BooksLink& each : BooksLink::all(books)) {
        const auto last = each.lastRun();
        const bool bad = last && !last->good;
        all.push_back({{"book", each.settings().name},
                       {"url", each.settings().url},
                       {"lastRun", last ? Json(last->date) : Json()},
                       {"good", last ? Json(last->good) : Json()},
                       {"message", bad ? Json(last->message) : Json()},
                       {"failingSince", bad ? Json(last->failingSince) : Json()}});
    }
    return all;
}

std::string linkText(const Json& link) {
    const std::string book = link["book"], url = link["url"];
    if (link["lastRun"].is_null()) return tr("{} with {}: not yet in step", book, url);
    if (link["good"].get<bool>())
        return tr("{} with {}: in step {}", book, url, shownDate(link["lastRun"].get<std::string>()));
    return tr("{} with {}: fails since {}: {}", book, url, shownDate(link["failingSince"].get<std::string>()),
              link["message"].get<std::string>());
}

void addBooksLinkCommands(CLI::App& books, Context& context) {
    const auto o = std::make_shared<LinkOptions>();
    const auto group = [o](CLI::App& c) {
        c.add_option("-g,--group", o->group, "A group's book instead of Contacts")->type_name(kGroupValue);
    };
    addCommand(
        books, context, "link", "Keep a book in step with one on another CardDAV server, by vdirsyncer",
        [&, group](CLI::App& c) {
            c.add_option("url", o->url, "The other address book's own address")->required();
            c.add_option("--user", o->user, "User name there; the password is asked for, or a line of standard input");
            c.add_option("--password-command", o->passwordCommand, "A command that prints the password");
            c.add_option("--ca-file", o->caFile, "Authority to trust there (PEM), when it is not a public one")
                ->type_name(kFileValue);
            group(c);
        },
        [&context, o] { link(context, *o); });
    addCommand(books, context, "unlink", "End that; both books stay as they are", group,
               [&context, o] { unlink(context, *o); });
    addCommand(books, context, "sync", "Bring all linked books in step now", nullptr, [&context] { syncAll(context); });
    // For vdirsyncer; nobody types it.
    addCommand(
        books, context, "merge-cards", "Make one card of two",
        [&](CLI::App& c) {
            c.add_option("cards", o->cards, "Two files")->type_name(kFileValue)->required()->expected(2);
        },
        [o] { mergeCards(*o); })
        ->group("");
}

} // namespace rolvane::cli
