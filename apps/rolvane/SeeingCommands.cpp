#include "SeeingCommands.h"

#include "Lookup.h"
#include "Publication.h"
#include "RecordJson.h"
#include "SafeText.h"
#include "Shares.h"
#include "Shown.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include <algorithm>
#include <fmt/format.h>
#include <map>
#include <set>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

const char* rightsOf(const Shares& shares, const std::string& user) {
    return shares.mayWrite(user) ? "write" : "read";
}

const char* rightsText(const Json& rights) {
    return rights == "write" ? translated("read and write") : translated("read");
}

// Through what the person is published: all contacts, or groups by name.
std::vector<std::string> publishedThrough(CXRolvane& database, const CXPerson& person) {
    const Publication publication(database);
    if (publication.everything()) return {translated("all your contacts")};
    std::vector<std::string> names;
    for (const CXGroupRef& group : publication.groups()) {
        const auto members = group->memberUniqueIds();
        if (std::find(members.begin(), members.end(), person.uniqueId()) != members.end())
            names.push_back(group->name());
    }
    return names;
}

std::string listed(const std::vector<std::string>& names) {
    std::string text;
    for (const std::string& name : names) text += (text.empty() ? "" : ", ") + shownLine(name);
    return text;
}

void who(Context& context, const std::string& named) {
    CXRolvane& database = context.database();
    const CXPersonRef person = findPerson(database, named);
    const std::string name = shownLine(person->displayName());
    if (person->isSubscribed()) {
        const std::string owner = publisherOf(person->remoteLocation());
        if (context.json)
            return context.print({{"identifier", person->uniqueId().str()},
                                  {"name", person->displayName()},
                                  {"owner", owner},
                                  {"through", nullptr},
                                  {"readers", nullptr}});
        return context.say(tr("{} is {}'s contact: {} decides who can see it.", name, owner, owner));
    }
    const std::vector<std::string> through = publishedThrough(database, *person);
    const Shares shares(database);
    Json readers = Json::array();
    if (!through.empty())
        for (const std::string& user : shares.readers())
            readers.push_back({{"user", user}, {"rights", rightsOf(shares, user)}});
    if (context.json)
        return context.print({{"identifier", person->uniqueId().str()},
                              {"name", person->displayName()},
                              {"owner", nullptr},
                              {"through", through},
                              {"readers", readers}});
    for (const Json& reader : readers)
        context.line(
            tr("{}  {}, through {}", reader["user"].get<std::string>(), rightsText(reader["rights"]), listed(through)));
    if (through.empty())
        context.say(tr("Nobody but you: {} is in nothing that you publish.", name));
    else if (readers.empty())
        context.say(
            tr("Nobody but you: {} is published through {}, but you share with nobody.", name, listed(through)));
}

// The content of the owner's tree: every reader sees all of it.
struct Preview {
    std::vector<CXListing> people;
    std::vector<CXGroupRef> groups;
};

Preview published(CXRolvane& database) {
    Shown shown = shownToReaders(database);
    Preview preview{database.listPeople(RemoteLocation("")), std::move(shown.groups)};
    std::erase_if(preview.people, [&](const CXListing& listing) { return !shown.people.contains(listing.uniqueId); });
    return preview;
}

void preview(Context& context, const std::string& user) {
    CXRolvane& database = context.database();
    const Shares shares(database);
    if (!Publication(database).anything())
        throw CommandError(kNotFound, tr("\"{}\" gets nothing: nothing is published. `rolvane publish` comes "
                                         "first.",
                                         user));
    if (!shares.mayRead(user))
        throw CommandError(kNotFound, tr("\"{}\" gets nothing: you do not share with them. `rolvane shares` "
                                         "lists with whom you do.",
                                         user));
    const Preview all = published(database);
    if (context.json) {
        Json people = Json::array(), groups = Json::array();
        for (const CXListing& listing : all.people)
            people.push_back({{"identifier", listing.uniqueId.str()}, {"name", listing.displayName}});
        for (const CXGroupRef& group : all.groups)
            groups.push_back({{"identifier", group->uniqueId().str()},
                              {"name", group->name()},
                              {"members", group->memberUniqueIds().size()}});
        return context.print(
            {{"user", user}, {"rights", rightsOf(shares, user)}, {"people", people}, {"groups", groups}});
    }
    for (const CXGroupRef& group : all.groups)
        context.line(fmt::format("{}  ({})", shownLine(group->name()),
                                 countedText(group->memberUniqueIds().size(), "member", "members")));
    for (const CXListing& listing : all.people) context.line(shownLine(listing.displayName));
    const std::string amount = amountText(all.people.size(), all.groups.size());
    context.say(shares.mayWrite(user)
                    ? tr("\"{}\" may read and change {}, as soon as the store has them.", user, amount)
                    : tr("\"{}\" may read {}, as soon as the store has them.", user, amount));
}

} // namespace

void addSeeingCommands(CLI::App& app, Context& context) {
    const auto named = std::make_shared<std::string>();
    addCommand(
        app, context, "who", "Tell who can see a contact, and through what",
        [&](CLI::App& command) {
            command.add_option("person", *named, "Name or identifier")->required()->type_name(kPersonValue);
        },
        [&context, named] { who(context, *named); });
    addCommand(
        app, context, "preview", "Show what a user with whom you share gets",
        [&](CLI::App& command) {
            command.add_option("user", *named, "User name on the store")->required()->type_name(kReaderValue);
        },
        [&context, named] { preview(context, *named); });
}

} // namespace rolvane::cli
