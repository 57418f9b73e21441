#pragma once

#include "model/CXDChangeRecord.h"

#include <unordered_set>

namespace rolvane {

// The group identifier that stands for all contacts; its changes are never folded.
inline const UniqueId kPeopleGroup{"People"};

// News of a group for the contact database goes behind what is written to that group's store: a fold takes in whatever
// stands in front of it, and what it has taken in never reaches the database. The order is kept otherwise. O(C).
void putNewsOfGroupsLast(CXDChangeRecords& records);

// Splits group changes into one record a source and folds the changes of one user's group into one composite, which
// takes the place of the group's last change. O(C) expected.
//
// A fold starts at a change that is addressed to something other than the contact database alone and is no composite,
// access-list change or deletion; it then takes in every earlier change of that group, whatever its type and sources.
// What merging refuses (CXDChangeRecord::canBeMerged, or a payload that cannot be read) stands for itself.
//
// A composite cannot say everything: access-list changes, deletions and earlier composites that a fold takes in are
// gone, and a deletion takes along what the fold has taken in before. `lost` (may be null) gets the groups where that
// befell a change from the contact database.
struct LostInFolds {
    std::unordered_set<UniqueId> lists;    // of the groups that lost an access-list change
    std::unordered_set<UniqueId> contents; // of those that lost another one: who is in them is not sure
};
CXDChangeRecords flattenGroupChanges(const CXDChangeRecords& records, LostInFolds* lost = nullptr);

// Sorts by CXDChangeRecord::compare; equal ones keep their order. O(C).
void sortByType(CXDChangeRecords& records);
// True of a change of the list of everybody, in whatever tree, that joins several.
bool isListOfEverybody(const CXDChangeRecord& record);
// Of sorted ones: changes of lists of everybody go before those of other groups. A contact that a group names and that
// list does not is half a contact. The order is kept otherwise. O(C).
void putListsOfEverybodyFirst(CXDChangeRecords& sorted);

} // namespace rolvane
