#include "engine/pass/OutOfOrderWork.h"

#include "engine/memory/PriorStates.h"
#include "engine/pass/ApplyLoop.h"
#include "engine/queue/RefusedChanges.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"

#include <algorithm>
#include <bit>
#include <charconv>
#include <iterator>
#include <system_error>
#include <utility>

namespace rolvane {

namespace {
constexpr double kIdleSeconds = 1.0; // a worker that gets nothing for so long ends
constexpr int64_t kDefaultWorkers = 3;
constexpr double kTerminationGlance = 0.2; // how often a wait without workers looks whether the process is to end
} // namespace

int64_t configuredWorkers(const NetworkAccount& account) {
    const Value configured = account.configValueForKey(kThreadCountKey, kDefaultWorkers);
    int64_t workers = configured.integer(kDefaultWorkers);
    if (const std::string* text = configured.stringIf()) {
        const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), workers);
        if (error != std::errc() || end != text->data() + text->size()) workers = kDefaultWorkers;
    }
    return std::min(workers, kMostWorkers);
}

OutOfOrderWork::OutOfOrderWork(EngineParts& parts, CXDChangeRecords records)
    : _parts(parts), _turns(records, [&](const UserName& user) { return parts.conduits.vaultra->writesInOrder(user); }),
      _outOfOrderLock(records.empty() ? 1 : 0),
      _records(std::make_move_iterator(records.begin()), std::make_move_iterator(records.end())),
      _changeCount(_records.size()) {}

OutOfOrderWork::~OutOfOrderWork() {
    finish();
}

void OutOfOrderWork::start(int64_t workers) {
    _outOfOrderLock.lock();
    addWorkers(workers);
    _workHere = _workers.empty() && workers > 0 && _changeCount > 0;
    _hasWorkers = !_workers.empty();
    _outOfOrderLock.unlock();
}

void OutOfOrderWork::addWorkers(int64_t workers) {
    const int64_t count = std::min(workers, static_cast<int64_t>(_changeCount));
    while (static_cast<int64_t>(_workers.size()) < count) {
        try {
            _workers.emplace_back([this] { outOfOrderWorkLoop(); });
        } catch (const std::system_error& e) {
            CXLog("Only %d of %d workers could be started: %s", _workers.size(), count, e.what());
            return;
        }
    }
}

// How many there are to be may depend on how far the store is, which its first answers tell.
void OutOfOrderWork::addWorkersIfWanted() {
    const int64_t wanted = configuredWorkers(_parts.with.account);
    _outOfOrderLock.lock();
    if (!_records.empty() && _hasWorkers) addWorkers(wanted);
    _outOfOrderLock.unlock();
}

void OutOfOrderWork::wait() {
    if (_workHere) outOfOrderWorkLoop();
    if (_hasWorkers || _changeCount == 0) {
        _outOfOrderLock.lockWhenCondition(1);
    } else {
        while (!_outOfOrderLock.lockWhenCondition(1, kTerminationGlance))
            if (_parts.terminating) outOfOrderWorkLoop();
    }
    _lockHeld = true;
}

void OutOfOrderWork::finish() {
    if (_finished) return;
    _finished = true;
    if (!_lockHeld) _outOfOrderLock.lock();
    // With condition 0 a worker that still waits finds nothing to take and ends at once.
    CXDChangeRecords untouched(_records.begin(), _records.end());
    _records.clear();
    _outOfOrderLock.unlockWithCondition(0);
    for (std::thread& worker : _workers) worker.join(); // nobody adds one where nothing is left
    _records.assign(untouched.begin(), untouched.end());
}

CXDChangeRecords OutOfOrderWork::takePending() {
    return std::move(_pending);
}

CXDChangeRecords OutOfOrderWork::takeUntouched() {
    return CXDChangeRecords(_records.begin(), _records.end());
}

void OutOfOrderWork::outOfOrderWorkLoop() {
    bool denied = false;
    for (;;) {
        if (!_outOfOrderLock.lockWhenCondition(0, kIdleSeconds)) return;
        if (_records.empty()) {
            _outOfOrderLock.unlockWithCondition(0);
            return;
        }
        const CXDChangeRecordPtr record = std::move(_records.front());
        _records.pop_front();
        const bool last = _records.empty();
        const bool waits = _turns.waitsForList(*record);
        if (waits) _waiting.insert(record);
        _outOfOrderLock.unlockWithCondition(0);

        _turns.await(*record);
        if (waits) {
            _outOfOrderLock.lock();
            _waiting.erase(record);
            _outOfOrderLock.unlock();
        }
        const int32_t wanted = record->appliesToSources();
        const int32_t applied = _parts.terminating ? 0 : apply(record, denied);
        if (applied != wanted || record.use_count() > 1) record->packPayload(); // somebody keeps it
        record->setAppliedToSources(applied);
        if (applied != wanted) {
            record->setAppliesToSources(applied ^ wanted);
            const Lock guard(_processedChangesLock);
            _pending.push_back(record);
        }
        _turns.done(*record);
        report(record);
        if (last && std::this_thread::get_id() == _parts.mainThread) return; // it must not wait for more
    }
}

int32_t OutOfOrderWork::apply(const CXDChangeRecordPtr& record, bool& denied) {
    const int32_t wanted = record->appliesToSources();
    int32_t applied = 0;
    if (wanted & CXDSyncSourceCX) {
        try {
            if (applyTo(*_parts.conduits.cx, CXDSyncSourceCX, record, denied)) applied |= CXDSyncSourceCX;
        } catch (const CXException& e) {
            CXLog("SyncEngine out of order workloop caught (CX) %@: %@", e.name(), e.reason());
        }
    }
    if (wanted & CXDSyncSourceVaultra) {
        try {
            if (applyTo(*_parts.conduits.vaultra, CXDSyncSourceVaultra, record, denied))
                applied |= CXDSyncSourceVaultra;
            if (denied) cancelLike(record);
        } catch (const CXException& e) {
            CXLog("SyncEngine out of order workloop caught (Vaultra) %@: %@", e.name(), e.reason());
        }
    }
    return applied;
}

bool OutOfOrderWork::applyTo(CXDConduit& conduit, int32_t source, const CXDChangeRecordPtr& record, bool& denied) {
    if (source == CXDSyncSourceVaultra) _parts.outcomes.tried(*record);
    if (!conduit.applyChangeRecordIfNeeded(record, &denied)) {
        if (denied && source == CXDSyncSourceVaultra) _parts.denied.noteRefused(record);
        return false;
    }
    if (isGivenUp(_parts, *record)) return true;
    _parts.outcomes.applied(*record, source);
    const Lock guard(_processedChangesLock);
    _parts.state.withConduitData([&](Dictionary& data) {
        didApplyChange(data, *record, source);
        forgetRefusedChange(data, *record);
    });
    return true;
}

// Once a user's waiting records are cancelled there are no more of them in the list: it only gets shorter.
void OutOfOrderWork::cancelLike(const CXDChangeRecordPtr& record) {
    CXDChangeRecords waiting;
    if (record->user()) {
        _outOfOrderLock.lock();
        if (_cancelledUsers.insert(*record->user()).second) {
            const auto isLike = [&](const CXDChangeRecordPtr& each) { return each->user() == record->user(); };
            std::copy_if(_records.begin(), _records.end(), std::back_inserter(waiting), isLike);
            std::copy_if(_waiting.begin(), _waiting.end(), std::back_inserter(waiting), isLike);
        }
        _outOfOrderLock.unlock();
    }
    _parts.denied.cancelLike(record, waiting);
}

void OutOfOrderWork::report(const CXDChangeRecordPtr& record) {
    _outOfOrderLock.lock();
    const bool isTimeToLook = std::has_single_bit(++_processedCount); // seldom, as it reads the preferences
    try {
        _parts.with.progress.didProcessChangeRecord(record);
    } catch (const CXException& e) {
        CXLog("Progress of a change record could not be reported: %@", e);
    }
    _outOfOrderLock.unlockWithCondition(_processedCount == _changeCount ? 1 : 0);
    if (isTimeToLook) addWorkersIfWanted();
}

} // namespace rolvane
