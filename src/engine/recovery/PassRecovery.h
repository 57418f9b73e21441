#pragma once

#include "engine/EngineParts.h"
#include "engine/queue/ChangeQueue.h"
#include "engine/recovery/Restatement.h"
#include "engine/recovery/UnderWay.h"

#include <functional>
#include <optional>
#include <utility>
#include <vector>

namespace rolvane {

// All that one pass owes to the passes before it, and all that it leaves to those behind it: changes that waited, the
// note of writes that a killed pass had begun, and groups whose changes were lost on the way. Built for one pass; main
// thread.
class PassRecovery {
public:
    explicit PassRecovery(EngineParts& parts) : _parts(parts) {}

    // The beginning: changes that waited are restated, and what was under way is made what the database says.
    // `records`: the pass's input, `fresh` new ones and then the queue.
    void begin(CXDChangeRecords& records, size_t fresh);
    // Of what waits for the shared folder, which no pass applies: what has become of it.
    void restateForTheFolder(CXDChangeRecords& waiting) const;

    // Before the first write: notes durably what is about to be written. What cannot be noted is not done: a later
    // pass would find it on the store, take it for somebody else's, and bring it back over what the owner has changed
    // meanwhile. Throws CXException.
    void willWrite(const CXDChangeRecords& outOfOrder);

    void lostInFolds(const LostInFolds& lost);
    // The store holds something else of this own group than the database; the next scan compares the two.
    void compareAgain(const UniqueId& group);

    // The end. `left`: the queue. Gives whether the next scan has a group to compare.
    bool end(const CXDChangeRecords& left);
    void storeNote(); // of writes that stay under way; without synchronising

private:
    void settle(CXDChangeRecords& records, size_t fresh);
    void storeNoteNow(bool gatheringChanged);
    std::vector<SharedTree> treesOf(const Dictionary& underWay) const;
    std::function<bool(const UserName&)> hasCopies() const;
    Restatement restatement() const;
    Dictionary withSubscriptions(Dictionary underWay) const;
    Dictionary mayHaveArrived(const CXDChangeRecords& left) const;
    std::vector<std::pair<UserName, CXSubscriptionRef>> subscriptionsOf(const Dictionary& underWay) const;
    void noteUnsettled(const UniqueId& group); // one of the owner's

    EngineParts& _parts;
    std::optional<Dictionary> _underWay; // none: the note of it was not read yet, and stays as it is
    Dictionary _namesOfOthers;           // in the place of such as a killed pass wrote, by group
    Dictionary _unsettled;               // groups whose changes may have been lost
    PassEnd _end;
};

} // namespace rolvane
