#include "Context.h"
#include "Lookup.h"
#include "SafeText.h"
#include "Texts.h"
#include "ValueNames.h"

#include "contacts/records/PersonJoining.h"

#include <fmt/format.h>
#include <fmt/ranges.h>
#include <memory>
#include <set>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

const char* wordFor(CXAlikeness alikeness) {
    switch (alikeness) {
    case CXAlikeness::same: return "same";
    case CXAlikeness::named: return "name";
    case CXAlikeness::reached: return "reached";
    case CXAlikeness::none: break;
    }
    return "none";
}

const char* reasonFor(CXAlikeness alikeness) {
    switch (alikeness) {
    case CXAlikeness::same: return translated("the same name, and an address or number in common");
    case CXAlikeness::named: return translated("the same name, and nothing else in common");
    case CXAlikeness::reached: return translated("different names, and an address or number in common");
    case CXAlikeness::none: break;
    }
    return "";
}

CXPersonRef personAt(CXRolvane& database, const UniqueId& uid) {
    return std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(uid));
}

void listDuplicates(Context& context) {
    CXRolvane& database = context.database();
    const auto found = findAlikePeople(database);
    Json all = Json::array();
    for (const AlikePeople& alike : found) {
        if (!context.json) context.line(std::string(reasonFor(alike.alikeness)) + ":");
        Json people = Json::array();
        for (const UniqueId& uid : alike.people) {
            const CXPersonRef person = personAt(database, uid);
            if (!person) continue;
            people.push_back({{"identifier", uid.str()}, {"name", person->displayName()}});
            if (!context.json) context.line("  " + uid.str() + "  " + shownLine(person->displayName()));
        }
        all.push_back({{"alike", wordFor(alike.alikeness)}, {"people", people}});
    }
    if (context.json)
        context.print(all);
    else if (found.empty())
        context.say(translated("Nobody looks like anybody else."));
    else
        context.say(translated("`rolvane merge` makes one of several."));
}

struct MergeOptions {
    std::vector<std::string> names;
    bool alike = false, dryRun = false;
};

// People to be made one: the first stays.
using Several = std::vector<CXPersonRef>;

// One name may be that of several people, who then are meant.
Several namedPeople(CXRolvane& database, const std::vector<std::string>& names) {
    Several people;
    std::set<UniqueId> seen;
    const auto add = [&](const CXPersonRef& person) {
        if (!seen.insert(person->uniqueId()).second) return;
        if (person->isSubscribed())
            throw CommandError(kRefused, tr("{} is a copy of somebody else's contact. Only people of your own "
                                            "can be made one.",
                                            person->displayName()));
        people.push_back(person);
    };
    if (names.size() == 1) {
        for (const CXListing& listing : peopleMatching(database, names.front(), true))
            if (listing.location.empty()) add(personAt(database, listing.uniqueId));
    } else {
        for (const std::string& name : names) add(findPerson(database, name, true));
    }
    if (people.size() < 2)
        throw CommandError(kNotFound,
                           translated("There are no two people to make one of. `rolvane duplicates` lists who looks "
                                      "alike; name them by their identifiers."));
    return people;
}

std::vector<Several> alikePeople(CXRolvane& database) {
    std::vector<Several> all;
    for (const AlikePeople& alike : findAlikePeople(database)) {
        if (alike.alikeness != CXAlikeness::same) continue;
        all.emplace_back();
        for (const UniqueId& uid : alike.people) all.back().push_back(personAt(database, uid));
    }
    return all;
}

void merge(Context& context, const MergeOptions& options) {
    if (options.alike != options.names.empty())
        throw CommandError(kUsage,
                           translated("Name people to make one of, or give --alike for all who surely are one."));
    CXRolvane& database = context.database();
    const std::vector<Several> all =
        options.alike ? alikePeople(database) : std::vector<Several>{namedPeople(database, options.names)};
    Json told = Json::array();
    size_t removed = 0;
    for (const Several& people : all) {
        Json joined = Json::array(), gaveWay = Json::array();
        const CXPersonRef& first = people.front();
        for (size_t i = 1; i < people.size(); i++) {
            const std::string name = people[i]->displayName();
            const UniqueId uid = people[i]->uniqueId();
            joined.push_back(uid.str());
            const auto lost = joinPeople(database, first, people[i]);
            removed++;
            context.say(tr("{} ({}) becomes one with {} ({}).", shownLine(name), uid.str(),
                           shownLine(first->displayName()), first->uniqueId().str()));
            for (const std::string& each : lost) {
                gaveWay.push_back(each);
                context.say(translated("  gave way, and stands in the note: ") + shownLine(each));
            }
        }
        told.push_back({{"identifier", first->uniqueId().str()},
                        {"name", first->displayName()},
                        {"joined", joined},
                        {"gaveWay", gaveWay}});
    }
    if (options.dryRun)
        database.rollback();
    else
        database.save();
    if (context.json) context.print(told);
    context.say(tr("{} joined with others.{}", countedText(removed, "person was", "people were"),
                   options.dryRun ? translated(" Nothing was changed: this was a trial.") : ""));
}

} // namespace

void addDuplicateCommands(CLI::App& app, Context& context) {
    const auto trial = std::make_shared<bool>(false);
    addCommand(
        app, context, "duplicates", "List people who look alike",
        [&](CLI::App& command) { command.add_flag("--dry-run", *trial, "Change nothing; that is so without it, too"); },
        [&context, trial] { listDuplicates(context); });

    const auto options = std::make_shared<MergeOptions>();
    addCommand(
        app, context, "merge", "Make one person of several",
        [&](CLI::App& command) {
            command
                .add_option("names", options->names,
                            "Names or identifiers; the first one stays. One name: all who are called so")
                ->type_name(kPersonValue);
            command.add_flag("--alike", options->alike,
                             "All who have the same name and an address or number in common");
            command.add_flag("--dry-run", options->dryRun, "Tell what would happen, and change nothing");
        },
        [&context, options] { merge(context, *options); });
}

} // namespace rolvane::cli
