#pragma once

#include "foundation/Date.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <functional>

namespace rolvane {

// Changes of the owner's own that the owner's store refuses (403). The owner's database stays as it is. The queue drops
// them, so the store is known not to hold them, and each scan makes them anew for as long as the database has them.
// They rest between two attempts: a minute, then twice as long each time, half an hour at most.
//
// Pure functions over the conduit data. Under the contact database's identifier stand
//
//   "unsettledPeople", "unsettledGroups": identifier -> true      whom and what the next scan sends or removes
//   "refusedByStore": {"notBefore": date, "pause": seconds, "denied": {identifier: true}, "leftOut": true}
//
// "denied" names whom and what the store itself refused, and not what was dropped along with it. Every other attempt
// leaves these out where there are other changes, so that one file that may not be written keeps no other waiting.

inline constexpr double kFirstPause = 60, kLongestPause = 1800; // seconds

// True while a change of the owner's has been refused and not been taken since.
bool hasRefusedChanges(const Dictionary& conduitData);
// How many people and groups wait for that.
size_t countRefusedChanges(const Dictionary& conduitData);

// True of a change that no scan has to be told of, because it is found anew for as long as it is to be made: somebody
// else may make it needless meanwhile.
using FindsAgain = std::function<bool(const CXDChangeRecord& record)>;

// Notes what a pass was refused: `dropped`, all of the denied records; `refused`, those among them that the store
// itself has denied. Others than the owner's writes are left out. An attempt that was made while earlier refusals
// rested does not lengthen their rest.
void noteRefusedChanges(Dictionary& conduitData, const CXDChangeRecords& dropped, const CXDChangeRecords& refused,
                        const FindsAgain& findsAgain, Date now);
// Takes out of what a full pass has gathered what rests, and leaves it to the next scan. Access-list changes never
// rest: the store keeps lists whatever it says to files, and a right that was taken back must not wait.
void holdBackRefusedChanges(Dictionary& conduitData, CXDChangeRecords& gathered, const FindsAgain& findsAgain,
                            Date now);
// The end of a full pass in which nothing was refused: without anything left to send, all is forgotten.
void settleRefusedChanges(Dictionary& conduitData, Date now);
// The store has taken a change: it is left to no scan any more.
void forgetRefusedChange(Dictionary& conduitData, const CXDChangeRecord& taken);
// The publication has ended.
void forgetRefusedChanges(Dictionary& conduitData);

} // namespace rolvane
