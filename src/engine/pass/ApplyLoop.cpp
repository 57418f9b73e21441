#include "engine/pass/ApplyLoop.h"

#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "engine/memory/PriorStates.h"
#include "engine/pass/OutOfOrderWork.h"
#include "engine/queue/ChangeQueue.h"
#include "engine/queue/Mingler.h"
#include "engine/queue/RecordIdentity.h"
#include "engine/queue/RefusedChanges.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"
#include "store/files/CXFileManager.h"

#include <algorithm>
#include <iterator>
#include <utility>

namespace rolvane {

namespace {

void append(CXDChangeRecords& to, CXDChangeRecords&& from) {
    to.insert(to.end(), std::make_move_iterator(from.begin()), std::make_move_iterator(from.end()));
}

CXDChangeRecords mingled(const CXDChangeRecords& input) {
    Mingler mingler;
    mingler.mingle(input);
    return mingler.takeMingled();
}

// Tells the file managers what the apply loop is going to read, and that it has ended.
class ReadingAhead {
public:
    ReadingAhead(const CXDChangeRecords& records, const CXDConduit& database) {
        std::vector<Url> urls;
        for (const CXDChangeRecordPtr& record : records) {
            if (!(record->appliesToSources() & CXDSyncSourceCX) || !record->delayedPayloadURL()) continue;
            if (database.swallows(*record)) continue;
            if (!_manager) _manager = record->fileManager();
            if (record->fileManager() != _manager) continue;
            urls.push_back(*record->delayedPayloadURL());
            _positions.push_back(static_cast<size_t>(&record - records.data()));
        }
        if (_manager) _manager->expectReads(urls, true); // payloads are read securely
    }
    ~ReadingAhead() {
        if (_manager) _manager->expectReads({}, true);
    }
    // The position of the record that has `count` such ones behind it; past the end where there are not so many.
    size_t lastBut(size_t count) const {
        return _positions.size() > count ? _positions[_positions.size() - 1 - count] : SIZE_MAX;
    }
    ReadingAhead(const ReadingAhead&) = delete;
    ReadingAhead& operator=(const ReadingAhead&) = delete;

private:
    CXFileManager* _manager = nullptr; // of the network store, the one that a pass reads
    std::vector<size_t> _positions;    // of the records that read something
};

} // namespace

void saveACLs(EngineParts& parts) {
    parts.conduits.vaultra->saveACLs();
    parts.conduits.cx->saveACLs();
}

ApplyLoop::ApplyLoop(EngineParts& parts, Actions actions)
    : _parts(parts), _actions(std::move(actions)), _recovery(parts), _arrived(parts), _refusals(parts) {}
ApplyLoop::~ApplyLoop() = default;

void ApplyLoop::run(CXDChangeRecords records, bool trickle, bool allowRetry) {
    _unhandled = std::move(records);
    updateStateAndExitIfNeeded(_parts);
    _parts.with.progress.startedPhase(2);
    _actions.persist();

    std::exception_ptr foreign;
    try {
        applyAll(trickle);
    } catch (const CXException& e) {
        CXLog("applyChangeRecords: Caught %@: %@", e.name(), e.reason());
        _parts.outcomes.caught(e.reason());
    } catch (...) {
        foreign = std::current_exception();
    }
    cleanUp();
    if (foreign) std::rethrow_exception(foreign);

    std::exception_ptr notStored;
    try {
        storeAndClose(allowRetry);
    } catch (const CXException& e) {
        CXLog("applyChangeRecords close: Caught %@: %@", e.name(), e.reason());
        _parts.outcomes.couldNotStore(e.reason());
        if (!isLeftOut("rollback")) _parts.with.rolvane.rollback();
        _parts.state.dropConduitData();
        if (!isLeftOut("rollback of versions")) _parts.conduits.vaultra->passWasNotStored();
        if (trickle) notStored = std::current_exception();
    }
    _parts.marksOfThePass = {};
    _parts.saveInThePass = false;
    _parts.denied.clear(); // also when nothing could be stored: what comes again is to be asked again
    _parts.revoked.clear();
    _parts.with.progress.stop();
    _actions.persist();
    // Whoever handed the changes over still has them, and must not take them for done. A full pass finds its own again.
    if (notStored) std::rethrow_exception(notStored);
}

void ApplyLoop::applyAll(bool trickle) {
    if (trickle) {
        CXDLog("TRICKLE");
        _parts.conduits.cx->open();
        _parts.conduits.vaultra->open();
    }
    const size_t fresh = _unhandled.size();
    append(_unhandled, _parts.state.getPendingChanges());
    _queueTaken = true;
    setAside(fresh);
    _recovery.begin(_unhandled, fresh);
    queue();
    _parts.with.progress.startedPhase(3);
    split();
    applyOutOfOrder();
    applyInOrder();
}

// What waits for the shared folder alone is applied by no pass, and says nothing about what the store holds: news of
// the same contact would be taken for contradicted, or left for later, for as long as it waits.
void ApplyLoop::setAside(size_t fresh) {
    const auto queue = _unhandled.begin() + static_cast<std::ptrdiff_t>(fresh);
    const auto first = std::stable_partition(queue, _unhandled.end(), [](const CXDChangeRecordPtr& record) {
        return !waitsForTheSharedFolderAlone(*record);
    });
    _setAside.assign(first, _unhandled.end());
    _unhandled.erase(first, _unhandled.end());
    if (_setAside.empty()) return;
    const std::unordered_set<CXDChangeRecordPtr, RecordHash, RecordEqual> again(_unhandled.begin(), _unhandled.end());
    std::erase_if(_setAside, [&](const CXDChangeRecordPtr& record) { return again.contains(record); });
    _recovery.restateForTheFolder(_setAside);
    _setAside = flattenGroupChanges(mingled(_setAside));
    for (const CXDChangeRecordPtr& record : _setAside) record->packPayload();
}

// What the contact database swallows changes nothing, so it contradicts nothing: the owner's own change would be given
// up for it, in this pass and in every following one.
CXDChangeRecords ApplyLoop::accepted() {
    CXDChangeRecords swallowed, others;
    for (const CXDChangeRecordPtr& record : _unhandled)
        (_parts.conduits.cx->swallows(*record) ? swallowed : others).push_back(record);
    _takenOut = TakenOut(others);
    for (const GroupThatIsGone& gone : _takenOut.drop(others)) {
        const Dictionary known = _parts.state.conduitData()[kConduitVaultra].dictionary()[kPriorState].dictionary();
        const Value& name = known[gone.user.str()].dictionary()[gone.group.str()].dictionary()[kCXGroupNameProperty];
        _parts.state.noteRefused({gone.user, kRefusedAsGroupIsGone, name.string()});
    }
    CXDChangeRecords all = mingled(others);
    append(all, mingled(swallowed));
    return all;
}

void ApplyLoop::queue() {
    CXDChangeRecords accepted = this->accepted();
    CXDLog("Mingled: %@", accepted);
    putNewsOfGroupsLast(accepted);
    LostInFolds lost;
    CXDChangeRecords flat = flattenGroupChanges(accepted, &lost);
    _recovery.lostInFolds(lost);
    sortByType(flat);
    putListsOfEverybodyFirst(flat);
    _totalCount = flat.size();
    _processedCount = 0;
    CXDLog("Flat: %@", flat);
    _unhandled = std::move(flat);
}

void ApplyLoop::split() {
    for (const CXDChangeRecordPtr& record : _unhandled) _parts.with.progress.willProcessChangeRecord(record);
    CXDChangeRecords outOfOrder;
    for (CXDChangeRecordPtr& record : _unhandled)
        (record->canApplyOutOfOrder() ? outOfOrder : _inOrder).push_back(std::move(record));
    _unhandled.clear();
    _outOfOrder = std::make_unique<OutOfOrderWork>(_parts, outOfOrder);
    _recovery.willWrite(outOfOrder);
}

void ApplyLoop::applyOutOfOrder() {
    _outOfOrder->start(configuredWorkers(_parts.with.account));
    _outOfOrder->wait();
    _processedCount += _outOfOrder->processedCount();
    _refusals.note();
    takeInMerged();
}

// What was merged on its way to the store is taken into the database as if it had come from there.
void ApplyLoop::takeInMerged() {
    CXDConduit& cx = *_parts.conduits.cx;
    for (const CXDChangeRecordPtr& update : _parts.conduits.vaultra->takeMerged())
        if (cx.swallows(*update) || !cx.applyChangeRecordIfNeeded(update, nullptr))
            _parts.conduits.vaultra->wasRefused(*update); // to be read again
}

void ApplyLoop::applyInOrder() {
    constexpr size_t kFew = 50;
    _left.emplace(_parts, _takenOut, _outOfOrder->pending());
    const ReadingAhead ahead(_inOrder, *_parts.conduits.cx);
    for (; _inOrderDone < _inOrder.size(); ++_inOrderDone) {
        const CXDChangeRecordPtr record = _inOrder[_inOrderDone]; // there may be more on the way
        if (_inOrderDone == ahead.lastBut(kFew) && !_parts.terminating) _parts.conduits.vaultra->willClose();
        applyInOrder(record);
        saveInThePass();
        ++_processedCount;
        _parts.with.progress.didProcessChangeRecord(record);
    }
    takeInMerged();
}

// The change that asked for it is done, and what is known says so.
void ApplyLoop::saveInThePass() {
    if (!std::exchange(_parts.saveInThePass, false)) return;
    _arrived.save(_inOrder, _inOrderDone);
}

void ApplyLoop::applyInOrder(const CXDChangeRecordPtr& record) {
    int32_t left = record->appliesToSources();
    if (!_parts.terminating && _left->meetsOwnWaitingWrite(*record)) {
        CXDLog("%@ waits until our own version is written", record);
        left = 0;
    } else if (!_parts.terminating && _left->isOfWhatWasTakenOutHere(*record)) {
        CXDLog("%@ is out", record);
        left = 0;
    } else if (!_parts.terminating) {
        if ((left & CXDSyncSourceCX) && applyTo(*_parts.conduits.cx, CXDSyncSourceCX, record)) left &= ~CXDSyncSourceCX;
        if (left & CXDSyncSourceVaultra) {
            if (applyTo(*_parts.conduits.vaultra, CXDSyncSourceVaultra, record)) left &= ~CXDSyncSourceVaultra;
            if (_denied) _refusals.cancelLike(record, _inOrder);
        }
    }
    if (left) {
        record->setAppliesToSources(left);
        _pendingChanges.push_back(record);
        record->packPayload();
    } else {
        record->setPayload({}); // nobody asks for it again; 50,000 contacts with photos would fill the memory
    }
}

bool ApplyLoop::applyTo(CXDConduit& conduit, int32_t source, const CXDChangeRecordPtr& record) {
    if (source == CXDSyncSourceVaultra) _parts.outcomes.tried(*record);
    if (!conduit.applyChangeRecordIfNeeded(record, &_denied)) {
        if (_denied && source == CXDSyncSourceVaultra) _parts.denied.noteRefused(record);
        return false;
    }
    if (isGivenUp(_parts, *record)) return true;
    const bool swallowed = conduit.swallows(*record);
    const bool ofOwnGroup = swallowed && noteSwallowed(*record);
    // Done with, but not remembered: the next comparison offers it again.
    if (swallowed && !ofOwnGroup && isOfAStrangeGroup(*record)) return true;
    if (!ofOwnGroup && !conduit.holds(*record)) {
        if (source == CXDSyncSourceCX) forgetGroupThatIsListed(*record);
        if (conduit.waitsForWhatFollows(*record)) tryAgainAtTheEnd(source, record);
        return true;
    }
    _parts.state.withConduitData([&](Dictionary& data) {
        didApplyChange(data, *record, source);
        forgetRefusedChange(data, *record);
    });
    _parts.outcomes.applied(*record, source);
    if (source == CXDSyncSourceCX) _arrived.note(record);
    return true;
}

// Additions come before removals, and one may wait for the other. What still cannot be done then contradicts what else
// is there; the next comparison offers it again.
void ApplyLoop::tryAgainAtTheEnd(int32_t source, const CXDChangeRecordPtr& record) {
    if (_secondTries.contains(record)) {
        CXLog("%@ contradicts what is there already, and is left out until it does not", record);
        return;
    }
    const CXDChangeRecordPtr again = record->copy();
    again->setAppliesToSources(source);
    _secondTries.insert(again);
    _inOrder.push_back(again);
    _parts.with.progress.willProcessChangeRecord(again);
    ++_totalCount;
}

// What is remembered of an own group then is what the store holds, a name without a contact included, and not what the
// database does. The next scan compares the two and gives the store the owner's. False of anything else: nobody knows
// whether the database ever had what it does not have, so that stays on the store.
bool ApplyLoop::noteSwallowed(const CXDChangeRecord& record) {
    if (isLeftOut("swallowed")) return false;
    switch (record.type()) {
    case CXDAddRecordToGroup:
    case CXDAddGroupToGroup:
    case CXDRemoveRecordFromGroup:
    case CXDRemoveGroupFromGroup:
    case CXDChangeGroupName:
    case CXDUpdateDistributionList: break;
    default: return false;
    }
    if (!record.group() || record.group()->str() == kCXAllGroupUID) return false;
    if (!_parts.with.rolvane.recordForUniqueId(cxUIDWithTableName(*record.group(), kCXGroupTable))) return false;
    _recovery.compareAgain(*record.group());
    return true;
}

// The list of everybody names a group that is known and that the database has lost, with a list that did not name it.
// It is announced once more.
void ApplyLoop::forgetGroupThatIsListed(const CXDChangeRecord& record) {
    if (record.type() != CXDAddGroupToGroup || !record.user() || !record.person() || !record.group() ||
        cxUIDWithTableName(*record.group(), kCXGroupTable).str() != kCXAllGroupUID)
        return;
    _parts.state.withConduitData([&](Dictionary& data) {
        Dictionary known =
            data[kConduitVaultra].dictionary()[kPriorState].dictionary()[record.user()->str()].dictionary();
        known.remove(cxUIDWithTableName(*record.person(), kCXGroupTable).str());
    });
}

// One that the database does not have. It comes when somebody may write, unless it is taken for known before.
bool ApplyLoop::isOfAStrangeGroup(const CXDChangeRecord& record) const {
    return record.group() && record.group()->str() != kCXAllGroupUID && record.type() != CXDDeleteGroup &&
           !_parts.with.rolvane.recordForUniqueId(cxUIDWithTableName(*record.group(), kCXGroupTable));
}

} // namespace rolvane
