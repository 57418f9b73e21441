#include "Consent.h"
#include "Context.h"
#include "ImportReport.h"
#include "Texts.h"
#include "ValueNames.h"
#include "Withdrawn.h"

#include "contacts/database/WithdrawnContacts.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

// What a person means: the name of a record, or a user of whom there is one.
WithdrawnContacts findWithdrawn(const std::string& named) {
    std::vector<WithdrawnContacts> found;
    for (const WithdrawnContacts& record : WithdrawnContactsFolder().list()) {
        if (record.name == named || record.file == named) return record;
        if (record.user.str() == named) found.push_back(record);
    }
    if (found.size() == 1) return found.front();
    if (found.empty())
        throw CommandError(kNotFound, tr("Nothing is kept of \"{}\". `rolvane withdrawn list` lists what is.", named));
    std::string list;
    for (const WithdrawnContacts& record : found) list += "\n  " + record.name;
    throw CommandError(kNotFound, tr("\"{}\" withdrew {} times. Name one of them:{}", named, found.size(), list));
}

void listWithdrawn(Context& context) {
    const Json all = withdrawnJson();
    if (context.json) return context.print(all);
    if (all.empty()) context.say(translated("Nobody has withdrawn contacts from you."));
    for (const Json& record : all)
        context.line(fmt::format("{}  {}", record["name"].get<std::string>(), withdrawnText(record)));
}

void importWithdrawn(Context& context, const std::string& named) {
    const WithdrawnContacts record = findWithdrawn(named);
    if (record.file.empty())
        throw CommandError(kNotFound, tr("There was nothing to keep when {} withdrew.", record.user.str()));
    reportImport(context, VCardImport::importFile(context.database(), record.file), 0);
}

void forgetWithdrawn(Context& context, const std::string& named, bool yes) {
    const WithdrawnContacts record = findWithdrawn(named);
    if (!record.file.empty())
        requireConsent(context, yes,
                       tr("Delete what is kept of {}, {} and {}? There is no other copy here.", record.user.str(),
                          countedText(record.people, "person", "people"),
                          countedText(record.groups, "group", "groups")),
                       translated("Nothing was deleted."));
    WithdrawnContactsFolder().forget(record);
    context.say(tr("{} is forgotten, with {}.", record.name, countedText(record.people, "person", "people")));
}

} // namespace

Json withdrawnJson() {
    Json all = Json::array();
    for (const WithdrawnContacts& record : WithdrawnContactsFolder().list())
        all.push_back({{"name", record.name},
                       {"user", record.user.str()},
                       {"location", record.location.str()},
                       {"date", record.date.toISO8601()},
                       {"people", record.people},
                       {"groups", record.groups},
                       {"file", record.file.empty() ? Json() : Json(record.file)}});
    return all;
}

std::string withdrawnText(const Json& record) {
    const size_t people = record["people"], groups = record["groups"];
    return tr("{}'s, {} and {}, on {}{}", record["user"].get<std::string>(), countedText(people, "person", "people"),
              countedText(groups, "group", "groups"), shownDate(record["date"].get<std::string>()),
              record["file"].is_null() ? "" : tr(", kept in {}", record["file"].get<std::string>()));
}

void addWithdrawnCommands(CLI::App& app, Context& context) {
    CLI::App* withdrawn = addCommand(
        app, context, "withdrawn", "Contacts that their publisher no longer shares: list, take back", nullptr, nullptr);
    withdrawn->require_subcommand(1);
    const auto named = std::make_shared<std::string>();
    const auto name = [named](CLI::App& command) {
        command.add_option("name", *named, "Name in the list, or the publisher's")
            ->required()
            ->type_name(kWithdrawnValue);
    };
    addCommand(*withdrawn, context, "list", "List whose left, when, how many, and where they are kept", nullptr,
               [&context] { listWithdrawn(context); });
    addCommand(*withdrawn, context, "import", "Take kept contacts as your own", name,
               [&context, named] { importWithdrawn(context, *named); });
    const auto yes = std::make_shared<bool>(false);
    addCommand(
        *withdrawn, context, "forget", "Delete what is kept",
        [name, yes](CLI::App& command) {
            name(command);
            declareConsent(command, *yes);
        },
        [&context, named, yes] { forgetWithdrawn(context, *named, *yes); });
}

} // namespace rolvane::cli
