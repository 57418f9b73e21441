// The end of a pass: what is left goes into the queue, and one commit stores everything.

#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "engine/memory/PassCommit.h"
#include "engine/pass/ApplyLoop.h"
#include "engine/pass/OutOfOrderWork.h"
#include "engine/recovery/UnderWay.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"

#include <algorithm>
#include <iterator>
#include <utility>

namespace rolvane {

namespace {

void append(CXDChangeRecords& to, CXDChangeRecords&& from) {
    to.insert(to.end(), std::make_move_iterator(from.begin()), std::make_move_iterator(from.end()));
}

} // namespace

bool waitsForTheSharedFolderAlone(const CXDChangeRecord& record) {
    return record.appliesToSources() == CXDSyncSourceLocal;
}

void ApplyLoop::cleanUp() {
    try {
        saveACLs(_parts);
    } catch (const CXException& e) {
        CXLog("applyChangeRecords: Caught %@: %@", e.name(), e.reason());
    }
    carryOver();
    _parts.locks.unlockAllURLs();
}

// After a pass that ran to its end this gathers what the workers left; after an exception also what nobody came to.
void ApplyLoop::carryOver() {
    if (_outOfOrder) {
        _outOfOrder->finish();
        CXDChangeRecords pending = _outOfOrder->takePending();
        append(pending, std::move(_pendingChanges));
        append(pending, _outOfOrder->takeUntouched());
        _pendingChanges = std::move(pending);
        _outOfOrder.reset();
    }
    for (; _inOrderDone < _inOrder.size(); ++_inOrderDone) {
        const CXDChangeRecordPtr& record = _inOrder[_inOrderDone];
        if (_pendingChanges.empty() || _pendingChanges.back() != record) _pendingChanges.push_back(record);
    }
    _inOrder.clear();
    append(_pendingChanges, std::move(_unhandled));
    _unhandled.clear();
    append(_pendingChanges, std::exchange(_setAside, {}));
}

void ApplyLoop::storeAndClose(bool allowRetry) {
    PassCommit commit(_parts.with.rolvane, _parts.with.preferences, _parts.state);
    storeQueue(allowRetry);
    closeConduits();
    bumpShareCount();
    commit.commit();
    _parts.conduits.vaultra->passWasStored();
    try {
        _parts.with.preferences.synchronize(kDaemonDomain); // the outcome, which changes nothing of what is stored
    } catch (const CXException& e) {
        _parts.outcomes.couldNotStore(e.reason()); // told, and tried again, when the pass ends
    }
}

void ApplyLoop::storeQueue(bool allowRetry) {
    if (!_queueTaken) append(_pendingChanges, _parts.state.getPendingChanges());
    for (const UserName& user : _refusals.ofCopies()) _parts.outcomes.refused(user);
    std::erase_if(_pendingChanges, [&](const CXDChangeRecordPtr& record) { return _parts.denied.contains(*record); });
    CXDLog("Pending: %@", _pendingChanges);
    CXDLog("Denied:  %@", _parts.denied.all());
    _parts.outcomes.leaves(_pendingChanges);
    _refusals.note();
    _refusals.takeBack();
    _parts.state.setPendingChanges(_pendingChanges);
    const bool nothingWaits =
        std::all_of(_pendingChanges.begin(), _pendingChanges.end(),
                    [](const CXDChangeRecordPtr& record) { return waitsForTheSharedFolderAlone(*record); });
    const bool lookAgain = _recovery.end(_pendingChanges) && nothingWaits;
    _pendingChanges.clear();
    _refusals.tell();
    if (!_parts.denied.empty() || lookAgain) {
        _parts.denied.clear();
        if (allowRetry) _actions.scheduleRetry();
    }
}

// The applied changes count even where a source cannot be closed.
void ApplyLoop::closeConduits() {
    try {
        _parts.conduits.cx->close();
        _parts.conduits.vaultra->close();
    } catch (const CXException& e) {
        CXLog("applyChangeRecords close: Caught %@: %@", e.name(), e.reason());
        _parts.outcomes.couldNotStore(e.reason());
    }
}

void ApplyLoop::bumpShareCount() {
    CXRolvane& rolvane = _parts.with.rolvane;
    Preferences& preferences = _parts.with.preferences;
    const int64_t count = rolvane.shareCount() + 1;
    preferences.set(kDaemonDomain, kCXDShareCount, count);
    rolvane.setShareCount(count);
    rolvane.save();
    const std::optional<UserName> user = _parts.with.account.vaultraUser();
    preferences.set(kDaemonDomain, kCXDLastOstrelUser, user ? Value(*user) : Value());
    _recovery.storeNote();
    _parts.state.putConduitData();
    if (preferences.get(kDaemonDomain, kCXDKnownDatabase) != Value(rolvane.databaseIdentity()))
        preferences.set(kDaemonDomain, kCXDKnownDatabase, rolvane.databaseIdentity());
    _parts.outcomes.put();
}

} // namespace rolvane
