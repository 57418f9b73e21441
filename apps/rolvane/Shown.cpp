#include "Shown.h"

#include "Publication.h"
#include "SafeText.h"
#include "Texts.h"

#include "contacts/records/Identifier.h"

namespace rolvane::cli {

std::string Shown::amount() const {
    const std::string text = countedText(people.size(), "person", "people");
    return groups.empty() ? text : amountText(people.size(), groups.size());
}

Shown shownToReaders(CXRolvane& database) {
    const Publication publication(database);
    Shown shown;
    if (!publication.everything()) {
        shown.groups = publication.groups();
        for (const CXGroupRef& group : shown.groups)
            for (const UniqueId& member : group->memberUniqueIds())
                if (const auto row = database.personRow(member); row && row->location.empty())
                    shown.people.insert(member);
        return shown;
    }
    for (const UniqueId& person : database.peopleOfTable(kCXPersonTable)) shown.people.insert(person);
    for (const CXListing& listing : database.listGroups(RemoteLocation("")))
        if (auto group = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(listing.uniqueId)))
            shown.groups.push_back(std::move(group));
    return shown;
}

std::string amountText(size_t people, size_t groups) {
    return tr("{} and {}", countedText(people, "person", "people"), countedText(groups, "group", "groups"));
}

std::string usersText(const std::vector<std::string>& users) {
    constexpr size_t kMost = 3;
    const size_t named = users.size() <= kMost ? users.size() : kMost - 1;
    std::string names;
    for (size_t i = 0; i < named; i++)
        names += (i == 0 ? "" : i + 1 == users.size() ? translated(" and ") : ", ") + shownLine(users[i]);
    if (named < users.size()) names += tr(" and {} others", users.size() - named);
    return countedText(users.size(), "user", "users") + (users.empty() ? "" : " (" + names + ")");
}

void declareTrial(CLI::App& command, bool& dryRun) {
    command.add_flag("--dry-run", dryRun, "Tell what would happen, and change nothing");
}

nlohmann::ordered_json trialJson(const Shown& what, const std::vector<std::string>& users) {
    return {{"dryRun", true}, {"people", what.people.size()}, {"groups", what.groups.size()}, {"users", users}};
}

Shown without(const Shown& all, const Shown& those) {
    Shown rest;
    for (const UniqueId& person : all.people)
        if (!those.people.contains(person)) rest.people.insert(person);
    std::set<UniqueId> groups;
    for (const CXGroupRef& group : those.groups) groups.insert(group->uniqueId());
    for (const CXGroupRef& group : all.groups)
        if (!groups.contains(group->uniqueId())) rest.groups.push_back(group);
    return rest;
}

} // namespace rolvane::cli
