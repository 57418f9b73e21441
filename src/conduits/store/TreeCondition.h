#pragma once

#include "foundation/Date.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

// Whether a published tree still is what it was: a store that is restored from an older copy, or that loses files, says
// the same as somebody who took contacts away. Pure functions over per-user states (see StoreComparison.h), with
//
//   "TreeDates" -> {"info" -> date, "dateFile" -> date}    of the tree's own files, as the store gives them
//
// beside the groups. The list of everybody decides what the absence of all contacts means: a list that is there and
// names nobody has been emptied, contact by contact; one that is not there, or is no list, has been lost. Whoever
// publishes touches "dateFile" at the end of each pass and writes "info" once. So neither a "dateFile" that is older
// than before nor another date of "info" is anybody's doing but the store's.
namespace rolvane {

inline constexpr const char* kTreeDates = "TreeDates";
inline constexpr const char* kNamesAlone = "NamesAlone";             // as namesTogether gives them
inline constexpr const char* kUnlistedContacts = "UnlistedContacts"; // name -> date since when it has been seen so

// Somebody who may write puts a new contact's file and its name on the store one after the other, in either order, and
// may be cut off in between for as long as a machine is switched off. One without the other is left so long.
inline constexpr double kPatience = 7 * 86400; // seconds

// Whether the owner's database, or a subscriber's copy, has a person or group of the tree.
using IsHere = std::function<bool(const UniqueId& name)>;

struct TreeCondition {
    enum class Kind {
        sound,
        setBack,      // an older copy, or a copy whose files have got new dates
        lostLists,    // there were contacts, and what said so is gone
        replacedList, // another list stands there, and all whom it does not name any longer still lie there
        lostAGroup,   // one that the tree's own lists still name; for a moment so while somebody deletes it
        lostContacts, // there were contacts, their list names some, and there is not one file of one; to its owner they
                      // are single ones that are missing
    };
    Kind kind = Kind::sound;
    std::string sentence; // what is wrong, for a log; empty when nothing is
    bool isSound() const { return kind == Kind::sound; }
    // For a moment it also looks so while somebody who may write is at it.
    bool mayPass() const { return kind == Kind::replacedList || kind == Kind::lostAGroup; }
};

// `prior` is the state that the last pass left, `current` what the store says now, both of one tree (one serial
// number). `lastVisit`: of the owner, the date that "dateFile" had when the owner's last pass ended.
// The owner knows of a list that is nowhere; to a subscriber the contacts that lie there are one.
// `isHere`: groups and contacts that have left this person's database, too, are deleted and not lost.
TreeCondition treeCondition(const Dictionary& prior, const Dictionary& current, std::optional<Date> lastVisit,
                            const IsHere& isHere = {});

// The groups that make a tree one that has lost a group.
std::vector<UniqueId> groupsThatAreLost(const Dictionary& prior, const Dictionary& current, const IsHere& isHere = {});

// Nobody but the owner can mend a tree that was set back. What to remember as its dates, so that it counts as set back
// until its owner has been there again.
Dictionary datesToWaitFor(const Dictionary& current);

// A list of everybody for a store that has none. One that was lost takes no group along.
Dictionary listOfAllThatLiesThere(const Dictionary& current);

// The changes of the owner's that take off the store whatever `prior` does not know: members, groups and contacts.
CXDChangeRecords removalOfLeftovers(const Dictionary& prior, const Dictionary& current);

// The changes of the owner's that take off the store what the list of everybody named in `prior`, does not name any
// longer, and still lies there: another writer has taken it out, and a change that was under way brought its file back.
CXDChangeRecords removalOfUnlisted(const Dictionary& prior, const Dictionary& current);

// Groups that are known, were named by no list of everybody yet, and whose state is gone: somebody else has deleted
// them, and no list tells it. Of those that `isHere` knows, which tells of the database.
std::vector<UniqueId> unlistedGroupsThatAreGone(const Dictionary& prior, const Dictionary& current,
                                                const IsHere& isHere);

// The owner's changes that take away known groups which lie there, are named by no list of everybody, and have left the
// database: no comparison of lists tells of them. `isHere` as above.
CXDChangeRecords removalOfUnlistedGroups(const Dictionary& prior, const Dictionary& current, const IsHere& isHere);

// The contacts and groups that groups name though neither the list of everybody nor a file does: group -> array of
// names. Somebody has put them there while somebody else deleted them; or a new one's file is still to come. `isHere`:
// the owner's database has it; one that the list has lost since `prior` is about to leave it. And the contacts and
// groups that the list of everybody itself names, and that are neither there nor here: they were deleted.
Dictionary namesAlone(const Dictionary& prior, const Dictionary& current, const IsHere& isHere);

// Groups within groups that the owner's database cannot take in: there, the inner one holds the outer one already, over
// others perhaps. Two people have nested them at the same time; or somebody is turning them round at this moment.
// Group -> array of groups. `subgroupsHere`: what a group holds in the owner's database, by shared names.
Dictionary closingCircles(const Dictionary& current,
                          const std::function<std::vector<UniqueId>(const UniqueId& group)>& subgroupsHere);

// The changes of the owner's that take such names out of their groups. At once: names that the list of everybody has
// lost since `prior`. At the second visit: those that close a circle, and groups that the list of everybody names and
// `prior` knows. After kPatience: all others. "NamesAlone" of `prior` tells since when each stands so.
CXDChangeRecords removalOfNamesAlone(const Dictionary& prior, const Dictionary& alone, const Dictionary& circles,
                                     Date now);

// Both together, as they are remembered: group -> {name -> date since when it stands so}. `before` is what the last
// visit remembered; an earlier version remembered arrays of names, whose time begins now.
Dictionary namesTogether(const Dictionary& before, const Dictionary& alone, const Dictionary& circles, Date now);

// Contacts that lie there and that no group names. Looks at all of them where their number and that of the list of
// everybody differ; else at `candidates` alone. None while that list is not there.
std::vector<UniqueId> contactsThatAreUnlisted(const Dictionary& current, const std::vector<UniqueId>& candidates);

// The change that takes one contact off the store.
CXDChangeRecordPtr removalOfContact(const UniqueId& person);

// Contacts that a group has lost since `prior`, and that the list of everybody did not name there: its readers know
// them by their groups alone.
std::vector<UniqueId> unlistedContactsThatLeftAGroup(const Dictionary& prior, const Dictionary& current);

// Those of the names, of contacts and groups, that the tree has neither a file of nor in any list. None while the list
// of everybody is not there.
std::vector<UniqueId> namesThatAreNowhere(const Dictionary& current, const std::vector<UniqueId>& names);

// The contacts that the list of everybody names and that are nowhere in the tree. Looks at nothing but two counts while
// none is missing and none is there besides.
std::vector<UniqueId> contactsThatAreMissing(const Dictionary& current);

// What the list of everybody names, to be asked for many.
class ListedNames {
public:
    // `list`: its contacts (kMemberUIDState) or its groups (kSubgroupUIDState).
    ListedNames(const Dictionary& state, const char* list);
    bool contains(const UniqueId& name) const { return _names.contains(name.str()); }
    bool empty() const { return _names.empty(); }

private:
    Array _list;
    std::unordered_set<std::string_view> _names; // in the list
};

} // namespace rolvane
