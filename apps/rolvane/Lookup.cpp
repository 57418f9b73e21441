#include "Lookup.h"

#include "Context.h"
#include "SafeText.h"
#include "Subscriptions.h"
#include "Suggestions.h"
#include "Texts.h"

#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <fmt/format.h>
#include <functional>

namespace rolvane::cli {

namespace {

constexpr size_t kIdentifierStart = 4; // characters of an identifier that are enough to name it

std::string folded(std::string text) {
    for (char& c : text)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return text;
}

// The listings that the words fit best: identifier, start of one, whole name, part of a name; the first rule that finds
// any wins.
std::vector<CXListing> matches(const std::vector<CXListing>& all, const std::string& named, bool whole) {
    const std::string wanted = folded(named);
    const auto chosen = [&](const auto& rule) {
        std::vector<CXListing> found;
        std::copy_if(all.begin(), all.end(), std::back_inserter(found), rule);
        return found;
    };
    if (auto found = chosen([&](const CXListing& l) { return folded(l.uniqueId.str()) == wanted; }); !found.empty())
        return found;
    if (auto found = chosen([&](const CXListing& l) { return l.displayName == named; }); !found.empty()) return found;
    if (auto found = chosen([&](const CXListing& l) { return folded(l.displayName) == wanted; }); !found.empty())
        return found;
    if (named.size() >= kIdentifierStart)
        if (auto found = chosen([&](const CXListing& l) { return folded(l.uniqueId.str()).starts_with(wanted); });
            !found.empty())
            return found;
    if (whole) return {};
    return chosen([&](const CXListing& l) { return folded(l.displayName).find(wanted) != std::string::npos; });
}

// `everybody` gives all that there is of the kind, for one who mistyped a name.
UniqueId only(const std::vector<CXListing>& found, const std::string& kind, const std::string& named,
              const std::function<std::vector<CXListing>()>& everybody) {
    if (found.size() == 1) return found.front().uniqueId;
    if (found.empty()) {
        std::vector<std::string> names;
        for (const CXListing& listing : everybody()) names.push_back(shownLine(listing.displayName));
        const std::string like = didYouMean(suggestions(named, names));
        throw CommandError(
            kNotFound, kind == "group"
                           ? tr("There is no group \"{}\".{} `rolvane group list` lists what there is.", named, like)
                           : tr("There is no person \"{}\".{} `rolvane list` lists what there is.", named, like));
    }
    constexpr size_t kShown = 10;
    std::string list;
    for (size_t i = 0; i < std::min(found.size(), kShown); ++i)
        list +=
            fmt::format("\n  {}  {}{}", found[i].uniqueId.str(), shownLine(found[i].displayName), ownerMark(found[i]));
    if (found.size() > kShown) list += tr("\n  and {} more", found.size() - kShown);
    throw CommandError(kNotFound, tr("\"{}\" fits {} {}. Name one by its identifier:{}", named, found.size(),
                                     kind == "person" ? translated("people") : translated("groups"), list));
}

} // namespace

// The same rules for people. Each rule asks an index, because an address book may hold many people.
std::vector<CXListing> peopleMatching(CXRolvane& database, const std::string& named, bool whole) {
    const bool mayBeIdentifier = named.size() >= kIdentifierStart;
    std::vector<CXListing> begun;
    if (mayBeIdentifier) begun = database.peopleNamed(named, CXRolvane::Named::byIdentifier);
    for (const CXListing& listing : begun)
        if (folded(listing.uniqueId.str()) == folded(named)) return {listing};
    const auto byName = database.peopleNamed(named, CXRolvane::Named::whole);
    std::vector<CXListing> exact;
    for (const CXListing& listing : byName)
        if (listing.displayName == named) exact.push_back(listing);
    if (!exact.empty()) return exact;
    if (!byName.empty()) return byName;
    if (!begun.empty()) return begun;
    return whole ? std::vector<CXListing>() : database.peopleNamed(named, CXRolvane::Named::part);
}

CXPersonRef findPerson(CXRolvane& database, const std::string& named, bool whole) {
    if (auto exact = std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(UniqueId(named)))) return exact;
    const UniqueId uid = only(peopleMatching(database, named, whole), "person", named,
                              [&] { return database.listPeople(std::nullopt); });
    return std::dynamic_pointer_cast<CXPerson>(database.recordForUniqueId(uid));
}

CXGroupRef findGroup(CXRolvane& database, const std::string& named, bool whole) {
    if (auto exact = std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(UniqueId(named)))) return exact;
    const auto groups = database.listGroups(std::nullopt);
    const UniqueId uid = only(matches(groups, named, whole), "group", named, [&] { return groups; });
    return std::dynamic_pointer_cast<CXGroup>(database.recordForUniqueId(uid));
}

void requireWritable(const CXRecord& record) {
    const auto* person = dynamic_cast<const CXPerson*>(&record);
    const auto* group = dynamic_cast<const CXGroup*>(&record);
    const std::string name = person ? person->displayName() : group ? group->name() : record.uniqueId().str();
    const std::string reason = record.readOnlyReason();
    if (reason.empty()) return;
    const std::string publisher = publisherOf(record.remoteLocation());
    if (publisher.empty()) throw CommandError(kRefused, reason);
    throw CommandError(kRefused, tr("\"{}\" is a copy of {}'s, which may be read but not changed. Ask {} for `rolvane "
                                    "share {} --write`.",
                                    name, publisher, publisher, CXDAVManager::vaultraUser()));
}

CXGroupRef findChangeableGroup(CXRolvane& database, const std::string& named, bool whole) {
    const CXGroupRef group = findGroup(database, named, whole);
    if (group->isAllGroup())
        throw CommandError(kRefused, tr("\"{}\" holds everybody; its members are not chosen.", group->name()));
    requireWritable(*group);
    return group;
}

} // namespace rolvane::cli
