#pragma once

#include "engine/EngineParts.h"
#include "engine/pass/RecordTurns.h"
#include "foundation/ConditionLock.h"
#include "model/CXDChangeRecord.h"

#include <deque>
#include <mutex>
#include <thread>
#include <unordered_set>
#include <vector>

namespace rolvane {

// How many workers a pass may have: a number, or a text that is one; 3 unless configured otherwise, 10 at most.
int64_t configuredWorkers(const NetworkAccount& account);

// The records of one pass that may be applied in any order, and the workers that apply them while the main thread
// waits. A worker takes the record at the front, waits while another is at work on the same group or person, applies it
// to the sources that it asks for, and reports it. A record with sources left over goes to the pending ones. Built,
// waited for and finished on the main thread.
//
// Condition of the lock: 0 while records are to hand out or in work, 1 when every record has been handled.
class OutOfOrderWork {
public:
    OutOfOrderWork(EngineParts& parts, CXDChangeRecords records);
    ~OutOfOrderWork(); // finishes

    // As many threads as asked for, at most one a record; none for zero or less. When the system gives no thread at
    // all, `wait` does the work itself.
    void start(int64_t workers);
    // Returns when every record has been handled; the lock is held from then on. Without workers and with records it
    // never returns, unless the process is asked to end.
    void wait();
    // Ends the workers that are still waiting for more. After it nothing of this object is shared with any thread.
    void finish();

    size_t processedCount() const { return _processedCount; } // after wait
    size_t workers() const { return _workers.size(); }
    const CXDChangeRecords& pending() const { return _pending; } // once nobody works any more
    CXDChangeRecords takePending();                              // after finish
    CXDChangeRecords takeUntouched();                            // after finish: what nobody has taken

private:
    void outOfOrderWorkLoop();
    int32_t apply(const CXDChangeRecordPtr& record, bool& denied); // the sources that are done
    bool applyTo(CXDConduit& conduit, int32_t source, const CXDChangeRecordPtr& record, bool& denied);
    void cancelLike(const CXDChangeRecordPtr& record);
    void report(const CXDChangeRecordPtr& record);

    EngineParts& _parts;
    RecordTurns _turns;
    ConditionLock _outOfOrderLock;
    std::deque<CXDChangeRecordPtr> _records;         // guarded by _outOfOrderLock
    std::unordered_set<CXDChangeRecordPtr> _waiting; // for a list, in a worker's hands; guarded by _outOfOrderLock
    std::unordered_set<UserName> _cancelledUsers;    // guarded by _outOfOrderLock
    size_t _processedCount = 0;                      // guarded by _outOfOrderLock
    const size_t _changeCount;
    std::mutex _processedChangesLock;
    CXDChangeRecords _pending; // guarded by _processedChangesLock
    std::vector<std::thread> _workers;
    bool _workHere = false;
    bool _lockHeld = false; // by the main thread, after wait
    bool _finished = false;
};

} // namespace rolvane
