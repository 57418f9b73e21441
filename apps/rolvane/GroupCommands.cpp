#include "Consent.h"
#include "Context.h"
#include "Lookup.h"
#include "Publication.h"
#include "RecordJson.h"
#include "Subscriptions.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/records/Constants.h"

#include <algorithm>
#include <fmt/format.h>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

struct GroupOptions {
    std::string group, name, person, property;
    std::string value;
    std::vector<std::string> names;
    bool clear = false, yes = false;
};

void listGroups(Context& context, const Whose& whose) {
    CXRolvane& database = context.database();
    Json all = Json::array();
    for (const CXListing& listing : database.listGroups(locationOf(database, whose))) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(listing.uniqueId));
        if (!group) continue;
        if (context.json)
            all.push_back(toJson(*group));
        else
            context.line(fmt::format("{}  {}  ({}, {}){}", group->uniqueId().str(), group->name(),
                                     countedText(group->memberCount(), "member", "members"),
                                     countedText(group->subgroupUniqueIds().size(), "group", "groups"),
                                     ownerMark(listing)));
    }
    if (context.json) context.print(all);
}

std::string nameOf(CXRolvane& database, const UniqueId& uid) {
    const CXRecordRef record = database.recordForUniqueId(uid);
    if (const auto person = std::dynamic_pointer_cast<CXPerson>(record)) return person->displayName();
    if (const auto group = std::dynamic_pointer_cast<CXGroup>(record)) return group->name();
    return uid.str();
}

void showGroup(Context& context, const std::string& named) {
    CXRolvane& database = context.database();
    const CXGroupRef group = findGroup(database, named);
    if (context.json) return context.print(toJson(*group));
    constexpr size_t kColumn = 18;
    context.line(group->name());
    context.row(translated("Identifier"), group->uniqueId().str(), kColumn);
    if (group->isSubscribed()) context.row(translated("From"), fromText(*group), kColumn);
    const auto choices = group->distributionChoices();
    for (const UniqueId& uid : group->subgroupUniqueIds())
        context.row(translated("Group"), nameOf(database, uid), kColumn);
    for (const UniqueId& uid : group->memberUniqueIds()) {
        std::string line = nameOf(database, uid);
        const auto person = std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(uid));
        if (const auto chosen = choices.find(uid); chosen != choices.end() && person)
            for (const auto& [property, identifier] : chosen->second)
                if (const auto values = person->multiValueForProperty(property))
                    line += fmt::format("  [{}: {}]", property, values->valueForIdentifier(identifier).description());
        context.row(translated("Member"), line, kColumn);
    }
}

// `done` names the group.
void tell(Context& context, CXGroup& group, const std::string& done) {
    if (context.json) context.print({{"identifier", group.uniqueId().str()}, {"name", group.name()}});
    context.say(done);
}

void createGroup(Context& context, const GroupOptions& options) {
    CXRolvane& database = context.database();
    for (const CXListing& other : database.listGroups(RemoteLocation("")))
        if (other.displayName == options.name)
            throw CommandError(kRefused, tr("There is a group \"{}\" already.", options.name));
    std::vector<CXPersonRef> members;
    for (const std::string& name : options.names) members.push_back(findPerson(database, name));
    const CXGroupRef group = CXGroup::create();
    if (!group->setValue(options.name, kCXGroupNameProperty))
        throw CommandError(kUsage, translated("A group needs a name."));
    database.addRecord(group);
    for (const CXPersonRef& person : members) group->addMember(person);
    database.save();
    if (!context.json) context.line(group->uniqueId().str());
    tell(context, *group, tr("\"{}\" made.", group->name()));
}

void renameGroup(Context& context, const GroupOptions& options) {
    const CXGroupRef group = findChangeableGroup(context.database(), options.group);
    const std::string former = group->name();
    if (!group->setValue(options.name, kCXGroupNameProperty))
        throw CommandError(kUsage, translated("A group needs a name."));
    context.database().save();
    tell(context, *group, tr("\"{}\" is the new name of \"{}\".", group->name(), former));
}

void deleteGroup(Context& context, const GroupOptions& options) {
    const CXGroupRef group = findChangeableGroup(context.database(), options.group, true);
    const std::string name = group->name();
    const Publication publication(context.database());
    if (!publication.everything() && publication.publishes(group))
        throw CommandError(kRefused, tr("\"{}\" is published by itself. Withdraw it first, with `rolvane "
                                        "unpublish --group`: its files would stay on the store.",
                                        name));
    requireConsent(context, options.yes,
                   tr("Delete the group \"{}\" with {}? The members stay.", name,
                      countedText(group->memberCount(), "member", "members")),
                   translated("Nothing was deleted."));
    context.database().removeRecord(group);
    context.database().save();
    context.say(tr("The group \"{}\" is deleted; its members stay.", name));
}

// Adds or removes members, all or none.
void changeMembers(Context& context, const GroupOptions& options, bool adding) {
    CXRolvane& database = context.database();
    const CXGroupRef group = findChangeableGroup(database, options.group);
    std::vector<CXPersonRef> people;
    for (const std::string& name : options.names) people.push_back(findPerson(database, name));
    size_t changed = 0;
    for (const CXPersonRef& person : people) changed += adding ? group->addMember(person) : group->removeMember(person);
    database.save();
    tell(context, *group,
         adding ? tr("\"{}\" has {}.", group->name(), countedText(changed, "new member", "new members"))
                : tr("\"{}\" lost {}.", group->name(), countedText(changed, "member", "members")));
}

void changeSubgroups(Context& context, const GroupOptions& options, bool adding) {
    CXRolvane& database = context.database();
    const CXGroupRef group = findChangeableGroup(database, options.group);
    std::vector<CXGroupRef> subgroups;
    for (const std::string& name : options.names) subgroups.push_back(findGroup(database, name));
    for (const CXGroupRef& subgroup : subgroups)
        adding ? group->addSubgroup(subgroup) : group->removeSubgroup(subgroup);
    database.save();
    tell(context, *group,
         adding ? tr("\"{}\" has the group in it.", group->name())
                : tr("\"{}\" no longer has the group in it.", group->name()));
}

// The value that is meant: by identifier, by text, by label.
std::string valueIdentifier(const CXPerson& person, const std::string& property, const std::string& named) {
    const auto values = person.multiValueForProperty(property);
    if (values)
        for (const CXMultiValue::Entry& entry : values->entries())
            if (entry.identifier == named || entry.value.string() == named || entry.label == named)
                return entry.identifier;
    std::string known;
    if (values)
        for (const CXMultiValue::Entry& entry : values->entries())
            known += fmt::format("\n  {}  {}  {}", entry.identifier, entry.label, entry.value.description());
    throw CommandError(kNotFound, tr("{} has no {} \"{}\".{}", person.displayName(), property, named,
                                     known.empty() ? "" : translated(" There are:") + known));
}

void choose(Context& context, const GroupOptions& options) {
    CXRolvane& database = context.database();
    const CXGroupRef group = findChangeableGroup(database, options.group);
    const CXPersonRef person = findPerson(database, options.person);
    const auto members = group->memberUniqueIds();
    if (std::find(members.begin(), members.end(), person->uniqueId()) == members.end())
        throw CommandError(kNotFound, tr("{} is no member of \"{}\".", person->displayName(), group->name()));
    if (options.clear == !options.value.empty())
        throw CommandError(kUsage, translated("Name the value that the group is to use, or give --clear."));
    std::optional<std::string> identifier;
    if (!options.clear) identifier = valueIdentifier(*person, options.property, options.value);
    group->setDistributionIdentifier(identifier, options.property, person);
    database.save();
    tell(context, *group,
         options.clear
             ? tr("\"{}\" has no choice of {} for {} any more.", group->name(), options.property, person->displayName())
             : tr("\"{}\" uses {} for {}.", group->name(), options.value, person->displayName()));
}

} // namespace

void addGroupCommands(CLI::App& app, Context& context) {
    CLI::App* group = addCommand(app, context, "group", "Groups: list, make, fill, rename", nullptr, nullptr);
    group->require_subcommand(1);
    const auto o = std::make_shared<GroupOptions>();
    const auto groupArgument = [o](CLI::App& c) {
        c.add_option("group", o->group, "Name or identifier")->required()->type_name(kGroupValue);
    };
    const auto with = [&](const char* name, const char* help, const std::function<void(CLI::App&)>& more,
                          std::function<void()> body) {
        addCommand(
            *group, context, name, help,
            [&](CLI::App& c) {
                groupArgument(c);
                if (more) more(c);
            },
            std::move(body));
    };
    const auto people = [o](CLI::App& c) {
        c.add_option("people", o->names, "Names or identifiers")->required()->type_name(kPersonValue);
    };
    const auto groups = [o](CLI::App& c) {
        c.add_option("subgroups", o->names, "Names or identifiers")->required()->type_name(kGroupValue);
    };

    const auto whose = std::make_shared<Whose>();
    addCommand(
        *group, context, "list", "List groups", [whose](CLI::App& c) { declareWhose(c, *whose); },
        [&context, whose] { listGroups(context, *whose); });
    addCommand(
        *group, context, "create", "Make a group; prints the identifier",
        [&](CLI::App& c) {
            c.add_option("name", o->name, "The group's name")->required();
            c.add_option("people", o->names, "Members, by name or identifier")->type_name(kPersonValue);
        },
        [&context, o] { createGroup(context, *o); });
    with("show", "Show members, groups in it and choices", nullptr, [&context, o] { showGroup(context, o->group); });
    with(
        "rename", "Give a group another name",
        [o](CLI::App& c) { c.add_option("name", o->name, "The new name")->required(); },
        [&context, o] { renameGroup(context, *o); });
    with(
        "delete", "Delete a group; its members stay, and a part of its name is not enough",
        [o](CLI::App& c) { declareConsent(c, o->yes); }, [&context, o] { deleteGroup(context, *o); });
    with("add", "Make people members", people, [&context, o] { changeMembers(context, *o, true); });
    with("remove", "Take members out", people, [&context, o] { changeMembers(context, *o, false); });
    with("add-group", "Put groups into a group", groups, [&context, o] { changeSubgroups(context, *o, true); });
    with("remove-group", "Take groups out of a group", groups, [&context, o] { changeSubgroups(context, *o, false); });
    with(
        "choose", "Choose which of a member's values the group uses",
        [o](CLI::App& c) {
            c.add_option("person", o->person, "The member")->required()->type_name(kPersonValue);
            c.add_option("property", o->property, "Email, Phone or Address")
                ->required()
                ->check(CLI::IsMember({kCXEmailProperty, kCXPhoneProperty, kCXAddressProperty}));
            c.add_option("value", o->value, "The value, its label or its identifier");
            c.add_flag("--clear", o->clear, "Use no value in particular");
        },
        [&context, o] { choose(context, *o); });
}

} // namespace rolvane::cli
