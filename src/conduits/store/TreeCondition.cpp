#include "conduits/store/TreeCondition.h"

#include "conduits/PublishedLayout.h"
#include "conduits/store/StoreComparison.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"

#include <algorithm>
#include <string>
#include <unordered_set>
#include <vector>

namespace rolvane {
namespace {

using Kind = TreeCondition::Kind;

const std::string kInfoFile(layout::kInfo), kClockFile(layout::kDateFile), kEverybody(layout::kAllGroup);
constexpr double kResolution = 1; // seconds, of a store's dates

std::optional<Date> dateIn(const Dictionary& state, const std::string& file) {
    return state[kTreeDates].dictionary()[file].date();
}

bool isGroup(std::string_view name) {
    return name.ends_with("CXGroup");
}

bool isOrMayBeHere(const IsHere& isHere, const Value& name) {
    return !isHere || isHere(UniqueId(name.string()));
}

bool isNamed(const Value& remembered, const std::string& name) {
    return remembered.isArray() ? remembered.array().containsString(name) : remembered.dictionary().contains(name);
}

Array groupsOfEverybody(const Dictionary& state) {
    return state[kEverybody].dictionary()[kSubgroupUIDState].array();
}

// The list of everybody says which groups there are, where it names any. Two people may delete a group and nest it at
// the same time, so another group can name one that is no more. Where single groups are published, that list may name
// none.
std::unordered_set<std::string> groupsThatAreListed(const Dictionary& prior, const Dictionary& current) {
    const bool everybodySays = !groupsOfEverybody(prior).empty() || !groupsOfEverybody(current).empty();
    std::unordered_set<std::string> listed;
    for (const auto& [name, group] : current)
        if (everybodySays ? name == kEverybody : isGroup(name))
            for (const Value& subgroup : group.dictionary()[kSubgroupUIDState].array())
                listed.insert(subgroup.string());
    return listed;
}

bool isSetBack(const Dictionary& prior, const Dictionary& current, const std::optional<Date>& lastVisit) {
    const auto visited = dateIn(current, kClockFile);
    for (const auto& before : {dateIn(prior, kClockFile), lastVisit})
        if (visited && before && visited->secondsSince(*before) <= -kResolution) return true;
    const auto made = dateIn(current, kInfoFile), madeBefore = dateIn(prior, kInfoFile);
    return made && madeBefore && *made != *madeBefore;
}

// A change of the list that met no list, and was written as if it were all of it. Who is deleted leaves the list and
// the tree; here nobody whom the list named before is in it, and every one of them lies there.
bool isListReplaced(const Array& before, const Array& now, const Dictionary& people, const IsHere& isHere) {
    if (now.empty() || before.count() < 2 || people.count() < before.count()) return false;
    std::unordered_set<std::string> named;
    for (const Value& name : now) named.insert(name.string());
    return std::all_of(before.begin(), before.end(), [&](const Value& name) {
        return !named.contains(name.string()) && people.contains(name.string()) && isOrMayBeHere(isHere, name);
    });
}

// Known ones that the list of everybody names neither now nor before. None where single groups are published, and that
// list names none.
std::vector<UniqueId> unlistedGroups(const Dictionary& prior, const Dictionary& current) {
    std::vector<UniqueId> unlisted;
    const ListedNames listed(current, kSubgroupUIDState), listedBefore(prior, kSubgroupUIDState);
    if (listed.empty() && listedBefore.empty()) return unlisted;
    for (const auto& [name, state] : prior) {
        if (!isGroup(name) || name == kEverybody || state.dictionary().empty()) continue;
        const UniqueId group(name);
        if (!listed.contains(group) && !listedBefore.contains(group)) unlisted.push_back(group);
    }
    return unlisted;
}

CXDChangeRecordPtr ownersChange(CXDChangeType type, std::optional<UniqueId> person, std::optional<UniqueId> group,
                                const Value& payload = {}) {
    auto record =
        std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, kSelf, std::move(person), std::move(group), payload);
    record->setAppliesToSources(CXDSyncSourceVaultra);
    return record;
}

} // namespace

TreeCondition treeCondition(const Dictionary& prior, const Dictionary& current, std::optional<Date> lastVisit,
                            const IsHere& isHere) {
    if (isLeftOut("lost tree")) return {};
    if (isSetBack(prior, current, lastVisit)) return {Kind::setBack, "is a copy from another time"};
    if (prior[kEverybody].dictionary()[kMemberUIDState].array().empty()) return {};
    const Dictionary people = current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    const bool hasContacts = !people.empty();
    const Value& everybody = current[kEverybody];
    const Array* listed = everybody.dictionary()[kMemberUIDState].arrayIf();
    if (!listed && (everybody || !hasContacts || lastVisit))
        return {Kind::lostLists, "has lost the list of its contacts"};
    if (listed && isListReplaced(prior[kEverybody].dictionary()[kMemberUIDState].array(), *listed, people, isHere))
        return {Kind::replacedList, "has another list, which names nobody of those who lie there"};
    if (!groupsThatAreLost(prior, current, isHere).empty())
        return {Kind::lostAGroup, "has lost a group that it still names"};
    // A writer takes a contact's file away before the name. Its owner writes what is missing, file by file.
    const bool misses = !listed || std::any_of(listed->begin(), listed->end(),
                                               [&](const Value& name) { return isOrMayBeHere(isHere, name); });
    if (!hasContacts && misses && !lastVisit) return {Kind::lostContacts, "has lost the contents of its contacts"};
    return {};
}

std::vector<UniqueId> groupsThatAreLost(const Dictionary& prior, const Dictionary& current, const IsHere& isHere) {
    std::vector<UniqueId> missing;
    for (const auto& [name, group] : prior)
        if (isGroup(name) && name != kEverybody && !group.dictionary().empty() && current[name].dictionary().empty())
            if (isOrMayBeHere(isHere, Value(name))) missing.emplace_back(name);
    if (missing.empty()) return missing;
    const auto listed = groupsThatAreListed(prior, current);
    std::erase_if(missing, [&](const UniqueId& name) { return !listed.contains(name.str()); });
    return missing;
}

Dictionary datesToWaitFor(const Dictionary& current) {
    Dictionary dates = current[kTreeDates].dictionary().mutableCopy();
    if (const auto visited = dateIn(current, kClockFile)) dates.set(kClockFile, visited->addingSeconds(kResolution));
    return dates;
}

Dictionary listOfAllThatLiesThere(const Dictionary& current) {
    Array people, groups;
    for (const auto& [contact, info] : current[kPeopleState].dictionary()[kMemberUIDState].dictionary())
        people.append(contact);
    for (const auto& [name, group] : current)
        if (isGroup(name)) groups.append(name);
    Dictionary list{{kMemberUIDState, people}};
    if (!groups.empty()) list.set(kSubgroupUIDState, groups);
    return list;
}

CXDChangeRecords removalOfLeftovers(const Dictionary& prior, const Dictionary& current) {
    CXDChangeRecords removals;
    const auto remove = [&](CXDChangeType type, std::optional<UniqueId> person, std::optional<UniqueId> group,
                            const Value& payload = {}) {
        removals.push_back(ownersChange(type, person, group, payload));
    };
    for (const auto& [name, state] : current) {
        if (!isGroup(name)) continue;
        if (!prior.contains(name)) {
            remove(CXDDeleteGroup, std::nullopt, UniqueId(name));
            continue;
        }
        const Dictionary difference = groupDifference(prior[name], state);
        const Array members = difference[kMemberAdds].array(), groups = difference[kSubgroupAdds].array();
        if (!members.empty() || !groups.empty())
            remove(CXDCompositeGroupChange, std::nullopt, UniqueId(name),
                   Dictionary{{kMemberRemoves, members}, {kSubgroupRemoves, groups}});
    }
    std::unordered_set<std::string> people;
    for (const Value& person : prior[kEverybody].dictionary()[kMemberUIDState].array()) people.insert(person.string());
    for (const auto& [person, info] : current[kPeopleState].dictionary()[kMemberUIDState].dictionary())
        if (!people.contains(person)) removals.push_back(removalOfContact(UniqueId(person)));
    return removals;
}

CXDChangeRecords removalOfUnlisted(const Dictionary& prior, const Dictionary& current) {
    CXDChangeRecords removals;
    const Value &before = prior[kEverybody], &now = current[kEverybody];
    if (!now.dictionary().contains(kMemberUIDState) || before == now) return removals;
    const Dictionary difference = groupDifference(before, now);
    const Dictionary people = current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    for (const Value& person : difference[kMemberRemoves].array())
        if (people.contains(person.string())) removals.push_back(removalOfContact(UniqueId(person.string())));
    for (const Value& group : difference[kSubgroupRemoves].array())
        if (!current[group.string()].dictionary().empty())
            removals.push_back(ownersChange(CXDDeleteGroup, std::nullopt, UniqueId(group.string())));
    return removals;
}

std::vector<UniqueId> unlistedGroupsThatAreGone(const Dictionary& prior, const Dictionary& current,
                                                const IsHere& isHere) {
    std::vector<UniqueId> gone;
    for (UniqueId& group : unlistedGroups(prior, current))
        if (current[group.str()].dictionary().empty() && isHere(group)) gone.push_back(std::move(group));
    return gone;
}

CXDChangeRecords removalOfUnlistedGroups(const Dictionary& prior, const Dictionary& current, const IsHere& isHere) {
    CXDChangeRecords removals;
    for (const UniqueId& group : unlistedGroups(prior, current))
        if (!current[group.str()].dictionary().empty() && !isHere(group))
            removals.push_back(ownersChange(CXDDeleteGroup, std::nullopt, group));
    return removals;
}

Dictionary namesAlone(const Dictionary& prior, const Dictionary& current, const IsHere& isHere) {
    Dictionary alone;
    if (!current[kEverybody].dictionary().contains(kMemberUIDState)) return alone;
    const ListedNames people(current, kMemberUIDState), peopleBefore(prior, kMemberUIDState);
    const ListedNames groups(current, kSubgroupUIDState), groupsBefore(prior, kSubgroupUIDState);
    const Dictionary files = current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    for (const auto& [name, state] : current) {
        if (!isGroup(name) || name == kEverybody) continue;
        Array names;
        const auto collect = [&](const Array& named, const ListedNames& listed, const ListedNames& before,
                                 const auto& isThere) {
            for (const Value& each : named) {
                const UniqueId uid(each.string());
                if (!listed.contains(uid) && !isThere(uid) && (before.contains(uid) || !isHere(uid)))
                    names.append(each);
            }
        };
        collect(state.dictionary()[kMemberUIDState].array(), people, peopleBefore,
                [&](const UniqueId& uid) { return files.contains(uid.str()); });
        if (!groups.empty() || !groupsBefore.empty()) // else single groups are published, and the list names none
            collect(state.dictionary()[kSubgroupUIDState].array(), groups, groupsBefore,
                    [&](const UniqueId& uid) { return !current[uid.str()].dictionary().empty(); });
        if (!names.empty()) alone.set(name, names);
    }
    Array nowhere;
    for (const UniqueId& uid : contactsThatAreMissing(current))
        if (!isHere(uid)) nowhere.append(uid);
    for (const Value& name : groupsOfEverybody(current))
        if (const UniqueId uid(name.string()); current[uid.str()].dictionary().empty() && !isHere(uid))
            nowhere.append(name);
    if (!nowhere.empty()) alone.set(kEverybody, nowhere);
    return alone;
}

Dictionary closingCircles(const Dictionary& current,
                          const std::function<std::vector<UniqueId>(const UniqueId& group)>& subgroupsHere) {
    const auto holdsHere = [&](const UniqueId& outer, const UniqueId& wanted) {
        std::unordered_set<UniqueId> seen;
        std::vector<UniqueId> next{outer};
        while (!next.empty()) {
            const UniqueId group = std::move(next.back());
            next.pop_back();
            if (group == wanted) return true;
            if (!seen.insert(group).second) continue;
            for (UniqueId& inner : subgroupsHere(group)) next.push_back(std::move(inner));
        }
        return false;
    };
    Dictionary closing;
    for (const auto& [name, state] : current) {
        if (!isGroup(name) || name == kEverybody) continue;
        Array names;
        for (const Value& inner : state.dictionary()[kSubgroupUIDState].array())
            if (holdsHere(UniqueId(inner.string()), UniqueId(name))) names.append(inner);
        if (!names.empty()) closing.set(name, names);
    }
    return closing;
}

CXDChangeRecords removalOfNamesAlone(const Dictionary& prior, const Dictionary& alone, const Dictionary& circles,
                                     Date now) {
    CXDChangeRecords removals;
    if (alone.empty() && circles.empty()) return removals;
    const ListedNames peopleBefore(prior, kMemberUIDState), groupsBefore(prior, kSubgroupUIDState);
    const Dictionary before = prior[kNamesAlone].dictionary();
    const auto remove = [&](const std::string& group, const Value& name) {
        removals.push_back(ownersChange(isGroup(name.string()) ? CXDRemoveGroupFromGroup : CXDRemoveRecordFromGroup,
                                        UniqueId(name.string()), UniqueId(group)));
    };
    for (const auto& [group, names] : alone)
        for (const Value& name : names.array()) {
            const UniqueId uid(name.string());
            const bool wasListed = group != kEverybody && (peopleBefore.contains(uid) || groupsBefore.contains(uid));
            const auto since = before[group].dictionary()[name.string()].date();
            // A group that was there once is not still to come.
            const bool hasTime = group != kEverybody || !prior.contains(uid.str());
            const double patience = hasTime ? kPatience : 0;
            if (wasListed || (since && now.secondsSince(*since) >= patience)) remove(group, name);
        }
    for (const auto& [group, names] : circles)
        for (const Value& name : names.array())
            if (isNamed(before[group], name.string())) remove(group, name);
    return removals;
}

Dictionary namesTogether(const Dictionary& before, const Dictionary& alone, const Dictionary& circles, Date now) {
    Dictionary all;
    for (const Dictionary& each : {alone, circles})
        for (const auto& [group, names] : each) {
            const Dictionary known = before[group].dictionary();
            Dictionary dates = all.dictionaryFor(group);
            for (const Value& name : names.array()) dates.set(name.string(), known[name.string()].date().value_or(now));
        }
    return all;
}

std::vector<UniqueId> contactsThatAreUnlisted(const Dictionary& current, const std::vector<UniqueId>& candidates) {
    std::vector<UniqueId> unlisted;
    const Array* everybody = current[kEverybody].dictionary()[kMemberUIDState].arrayIf();
    const Dictionary files = current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    if (!everybody || (files.count() == everybody->count() && candidates.empty())) return unlisted;
    std::unordered_set<std::string> named;
    for (const auto& [name, state] : current)
        if (isGroup(name))
            for (const Value& member : state.dictionary()[kMemberUIDState].array()) named.insert(member.string());
    const auto consider = [&](const std::string& name) {
        if (!named.contains(name)) unlisted.emplace_back(name);
    };
    if (files.count() != everybody->count()) {
        for (const auto& [name, info] : files) consider(name);
        return unlisted;
    }
    for (const UniqueId& name : candidates)
        if (files.contains(name.str())) consider(name.str());
    return unlisted;
}

std::vector<UniqueId> namesThatAreNowhere(const Dictionary& current, const std::vector<UniqueId>& names) {
    if (names.empty() || !current[kEverybody].dictionary()[kMemberUIDState].isArray()) return {};
    const Dictionary files = current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    std::unordered_set<std::string_view> named; // the state keeps the texts
    for (const auto& [group, state] : current)
        if (isGroup(group))
            for (const char* list : {kMemberUIDState, kSubgroupUIDState})
                for (const Value& name : state.dictionary()[list].array())
                    if (const std::string* text = name.stringIf()) named.insert(*text);
    std::vector<UniqueId> nowhere;
    for (const UniqueId& name : names)
        if (!files.contains(name.str()) && !current.contains(name.str()) && !named.contains(name.str()))
            nowhere.push_back(name);
    return nowhere;
}

std::vector<UniqueId> unlistedContactsThatLeftAGroup(const Dictionary& prior, const Dictionary& current) {
    std::vector<UniqueId> unlisted;
    std::optional<ListedNames> listed;
    for (const auto& [group, before] : prior) {
        if (!isGroup(group) || group == kEverybody || before == current[group]) continue;
        const Dictionary difference = groupDifference(before, current[group]);
        for (const Value& name : difference[kMemberRemoves].array()) {
            if (!listed) listed.emplace(prior, kMemberUIDState);
            if (const UniqueId contact(name.string()); !listed->contains(contact)) unlisted.push_back(contact);
        }
    }
    return unlisted;
}

CXDChangeRecordPtr removalOfContact(const UniqueId& person) {
    return ownersChange(CXDDeleteRecord, person, std::nullopt);
}

std::vector<UniqueId> contactsThatAreMissing(const Dictionary& current) {
    std::vector<UniqueId> missing;
    const Array listed = current[kEverybody].dictionary()[kMemberUIDState].array();
    const Dictionary people = current[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    if (people.count() >= listed.count()) return missing;
    for (const Value& name : listed)
        if (!people.contains(name.string())) missing.emplace_back(name.string());
    return missing;
}

ListedNames::ListedNames(const Dictionary& state, const char* list)
    : _list(state[kEverybody].dictionary()[list].array()) {
    _names.reserve(_list.count());
    for (const Value& member : _list)
        if (const std::string* name = member.stringIf()) _names.insert(*name);
}

} // namespace rolvane
