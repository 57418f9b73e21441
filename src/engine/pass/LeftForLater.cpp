#include "engine/pass/LeftForLater.h"

#include "contacts/records/Identifier.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

namespace rolvane {

bool LeftForLater::meetsOwnWaitingWrite(const CXDChangeRecord& record) {
    if (record.type() != CXDUpdateRecord || record.initialSource() == CXDSyncSourceCX || !record.person()) return false;
    if (!_waitingWrites) {
        _waitingWrites.emplace();
        for (const CXDChangeRecordPtr& waiting : _waiting)
            if (waiting->type() == CXDUpdateRecord && waiting->initialSource() == CXDSyncSourceCX &&
                waiting->person() && (waiting->appliesToSources() & CXDSyncSourceVaultra))
                _waitingWrites->emplace(waiting->user().value_or(UserName()), cxNormalizedUID(*waiting->person()));
        for (const std::string& person : _parts.state.conduitObjectForKey(kConduitCX, kUnsettledPeople).allKeys())
            _waitingWrites->emplace(kSelf, UniqueId(person)); // refused, and to be sent again
    }
    return !_waitingWrites->empty() &&
           _waitingWrites->contains({record.user().value_or(UserName()), cxNormalizedUID(*record.person())});
}

bool LeftForLater::isOfWhatWasTakenOutHere(const CXDChangeRecord& record) {
    if (record.initialSource() == CXDSyncSourceCX || !_takenOut.concerns(record)) return false;
    if (!_refusedUsers) {
        _refusedUsers.emplace();
        for (const CXDChangeRecordPtr& refused : _parts.denied.all())
            _refusedUsers->insert(refused->user().value_or(UserName()));
    }
    return !_refusedUsers->contains(record.user().value_or(UserName()));
}

} // namespace rolvane
