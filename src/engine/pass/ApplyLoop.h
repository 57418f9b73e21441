#pragma once

#include "engine/EngineParts.h"
#include "engine/queue/TakenOut.h"
#include "engine/recovery/UnderWay.h"
#include "model/CXDChangeRecord.h"

#include <exception>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <unordered_set>
#include <utility>
#include <vector>

namespace rolvane {

class OutOfOrderWork;
struct Restatement;

// One apply pass, from the records that were gathered to the queue that is left. Built for one pass on the main thread.
//
// Nothing is lost on the way: what an exception leaves unhandled stays pending, and the stored queue is replaced only
// after it has been read. The pass ends in one commit (engine/memory/PassCommit.h). Where that fails, or the process is
// killed before it, the pass has not been: the next one finds its changes again, and making them again changes nothing.
// A save before the end, for a new group or because too much waits in memory, is a commit, too, of contacts and
// of what is known of them.
class ApplyLoop {
public:
    struct Actions {
        std::function<void()> persist;       // arms the idle-exit timer
        std::function<void()> scheduleRetry; // one more full pass on the run loop, which schedules no other
    };
    ApplyLoop(EngineParts& parts, Actions actions);
    ~ApplyLoop();

    // applyChangeRecords:trickle:allowRetry:. Exceptions of the base class are logged and end nothing, but for one: a
    // trickle pass whose queue could not be stored throws at its end, so that the changes are delivered again.
    void run(CXDChangeRecords records, bool trickle, bool allowRetry);

private:
    void applyAll(bool trickle);
    void settleUnderWay();
    std::vector<SharedTree> treesOf(const Dictionary& underWay) const;
    Restatement restatement() const;
    std::function<bool(const UserName&)> hasCopies() const;
    Dictionary withSubscriptions(Dictionary underWay) const;
    std::vector<std::pair<UserName, CXSubscriptionRef>> subscriptionsOf(const Dictionary& underWay) const;
    void setAside(size_t fresh); // of the queue, which begins there
    void queue();                // _unhandled becomes the flat list
    CXDChangeRecords accepted();
    bool noteSwallowed(const CXDChangeRecord& record);
    void forgetGroupThatIsListed(const CXDChangeRecord& record);
    bool isOfAStrangeGroup(const CXDChangeRecord& record) const;
    void tryAgainAtTheEnd(int32_t source, const CXDChangeRecordPtr& record);
    void split();
    void noteUnderWay();
    void applyOutOfOrder();
    void noteRefused();
    void takeInMerged();
    void applyInOrder();
    void applyInOrder(const CXDChangeRecordPtr& record);
    void saveInThePass();
    void listArrived();
    void claimState();
    bool meetsOwnWaitingWrite(const CXDChangeRecord& record);
    bool isOfWhatWasTakenOutHere(const CXDChangeRecord& record);
    bool applyTo(CXDConduit& conduit, int32_t source, const CXDChangeRecordPtr& record);
    void cancelLike(const CXDChangeRecordPtr& record);
    void cleanUp();
    void carryOver();
    void storeAndClose(bool allowRetry);
    void storeQueue(bool allowRetry);
    void closeConduits();
    void tellRefused();
    void takeBack(const CXDChangeRecord& record);
    void noteUnsure(const UniqueId& group); // one of the owner's
    bool noteUnsettled();
    void bumpShareCount();

    EngineParts& _parts;
    Actions _actions;
    CXDChangeRecords _unhandled; // what an exception would leave behind: the input, then the flat list
    CXDChangeRecords _setAside;  // of the queue: what no pass applies
    bool _queueTaken = false;    // the stored queue is part of the pass
    CXDChangeRecords _pendingChanges;
    Dictionary _unsettled; // groups whose changes may have been lost, or applied in another order than they were made
    std::optional<Dictionary> _underWay; // none: the note of it was not read yet, and stays as it is
    bool _gatheringChanged = false;      // something in the database that is not saved yet
    PassEnd _end;
    CXDChangeRecords _inOrder;
    size_t _inOrderDone = 0;
    std::unordered_set<CXDChangeRecordPtr> _secondTries; // at the end of _inOrder
    CXDChangeRecords _arrived; // people and groups that the database has taken since it was saved last
    using Listings = std::map<std::pair<UserName, UniqueId>, CXDChangeRecordPtr>;
    std::optional<Listings> _listings; // by whose and who, the changes that put them into the list of all
    std::unique_ptr<OutOfOrderWork> _outOfOrder;
    bool _denied = false; // handed to every in-order apply; never cleared in a pass
    std::unordered_set<UserName> _cancelledUsers;
    std::optional<std::set<std::pair<UserName, UniqueId>>> _waitingWrites; // of contacts, that the workers left
    TakenOut _takenOut;
    std::optional<std::set<UserName>> _refusedUsers; // whose store has refused something to the workers
    size_t _totalCount = 0, _processedCount = 0;
};

// Is the record cancelled with a refused one, so that no source holds what it says? Not of changes in copies of
// somebody else's contacts: those count as made there, and the next comparison undoes them in the copy.
bool isGivenUp(EngineParts& parts, const CXDChangeRecord& record);

// No pass writes to that source.
bool waitsForTheSharedFolderAlone(const CXDChangeRecord& record);

// saveACLs: the network store's lists, then the contact database's.
void saveACLs(EngineParts& parts);

} // namespace rolvane
