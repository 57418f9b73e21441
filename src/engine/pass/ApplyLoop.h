#pragma once

#include "engine/EngineParts.h"
#include "engine/pass/ArrivedContacts.h"
#include "engine/pass/LeftForLater.h"
#include "engine/pass/PassRefusals.h"
#include "engine/queue/TakenOut.h"
#include "engine/recovery/PassRecovery.h"
#include "model/CXDChangeRecord.h"

#include <exception>
#include <functional>
#include <memory>
#include <optional>
#include <unordered_set>

namespace rolvane {

class OutOfOrderWork;

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
    void setAside(size_t fresh); // of the queue, which begins there
    void queue();                // _unhandled becomes the flat list
    CXDChangeRecords accepted();
    bool noteSwallowed(const CXDChangeRecord& record);
    void forgetGroupThatIsListed(const CXDChangeRecord& record);
    bool isOfAStrangeGroup(const CXDChangeRecord& record) const;
    void tryAgainAtTheEnd(int32_t source, const CXDChangeRecordPtr& record);
    void split();
    void applyOutOfOrder();
    void takeInMerged();
    void applyInOrder();
    void applyInOrder(const CXDChangeRecordPtr& record);
    void saveInThePass();
    bool applyTo(CXDConduit& conduit, int32_t source, const CXDChangeRecordPtr& record);
    void cleanUp();
    void carryOver();
    void storeAndClose(bool allowRetry);
    void storeQueue(bool allowRetry);
    void closeConduits();
    void bumpShareCount();

    EngineParts& _parts;
    Actions _actions;
    PassRecovery _recovery;
    ArrivedContacts _arrived;
    PassRefusals _refusals;
    CXDChangeRecords _unhandled; // what an exception would leave behind: the input, then the flat list
    CXDChangeRecords _setAside;  // of the queue: what no pass applies
    bool _queueTaken = false;    // the stored queue is part of the pass
    CXDChangeRecords _pendingChanges;
    CXDChangeRecords _inOrder;
    size_t _inOrderDone = 0;
    std::unordered_set<CXDChangeRecordPtr> _secondTries; // at the end of _inOrder
    std::unique_ptr<OutOfOrderWork> _outOfOrder;
    bool _denied = false; // handed to every in-order apply; never cleared in a pass
    TakenOut _takenOut;
    std::optional<LeftForLater> _left; // from the end of the workers on
    size_t _totalCount = 0, _processedCount = 0;
};

// No pass writes to that source.
bool waitsForTheSharedFolderAlone(const CXDChangeRecord& record);

// saveACLs: the network store's lists, then the contact database's.
void saveACLs(EngineParts& parts);

} // namespace rolvane
