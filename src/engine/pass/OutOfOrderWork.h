#pragma once

#include "engine/EngineParts.h"
#include "engine/pass/RecordTurns.h"
#include "foundation/ConditionLock.h"
#include "foundation/Mutex.h"
#include "model/CXDChangeRecord.h"

#include <deque>
#include <thread>
#include <unordered_set>
#include <vector>

namespace rolvane {

inline constexpr const char* kThreadCountKey = "CXDThreadCountKey";
inline constexpr int64_t kMostWorkers = 10;

// How many workers a pass may have: a number, or a text that is one; 3 unless configured otherwise, 10 at most. To a
// store that is far the network's account gives 10 where nothing is configured.
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
    // all, `wait` does the work itself. While they work there may become more, as `configuredWorkers` says then.
    void start(int64_t workers);
    // Returns when every record has been handled; the lock is held from then on. Without workers and with records it
    // never returns, unless the process is asked to end.
    void wait() NO_THREAD_SAFETY_ANALYSIS; // `finish` gives back the lock that it takes
    // Ends the workers that are still waiting for more. After it nothing of this object is shared with any thread.
    void finish() NO_THREAD_SAFETY_ANALYSIS;

    size_t processedCount() const NO_THREAD_SAFETY_ANALYSIS { return _processedCount; } // after wait
    size_t workers() const NO_THREAD_SAFETY_ANALYSIS { return _workers.size(); } // before and after they are at work
    // Once nobody works any more nothing guards them.
    const CXDChangeRecords& pending() const NO_THREAD_SAFETY_ANALYSIS { return _pending; }
    CXDChangeRecords takePending() NO_THREAD_SAFETY_ANALYSIS;   // after finish
    CXDChangeRecords takeUntouched() NO_THREAD_SAFETY_ANALYSIS; // after finish: what nobody has taken

private:
    void outOfOrderWorkLoop();
    int32_t apply(const CXDChangeRecordPtr& record, bool& denied); // the sources that are done
    bool applyTo(CXDConduit& conduit, int32_t source, const CXDChangeRecordPtr& record, bool& denied);
    void cancelLike(const CXDChangeRecordPtr& record);
    void report(const CXDChangeRecordPtr& record);
    void addWorkers(int64_t workers) REQUIRES(_outOfOrderLock);
    void addWorkersIfWanted();

    EngineParts& _parts;
    RecordTurns _turns;
    ConditionLock _outOfOrderLock;
    std::deque<CXDChangeRecordPtr> _records GUARDED_BY(_outOfOrderLock);
    std::unordered_set<CXDChangeRecordPtr> _waiting GUARDED_BY(_outOfOrderLock); // for a list, in a worker's hands
    std::unordered_set<UserName> _cancelledUsers GUARDED_BY(_outOfOrderLock);
    size_t _processedCount GUARDED_BY(_outOfOrderLock) = 0;
    const size_t _changeCount;
    Mutex _processedChangesLock;
    CXDChangeRecords _pending GUARDED_BY(_processedChangesLock);
    std::vector<std::thread> _workers GUARDED_BY(_outOfOrderLock);
    bool _hasWorkers = false; // from the start
    bool _workHere = false;
    bool _lockHeld = false; // by the main thread, after wait
    bool _finished = false;
};

} // namespace rolvane
