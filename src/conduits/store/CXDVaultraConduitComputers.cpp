// The part of the network store's conduit that keeps the owner's tree in step with other computers of the same person.

#include "conduits/PublishedLayout.h"
#include "conduits/TakingIn.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "conduits/store/ComputersOnStore.h"
#include "conduits/store/StoreComparison.h"
#include "conduits/store/TreeCondition.h"
#include "contacts/database/CXRolvane.h"
#include "foundation/Log.h"
#include "foundation/Preferences.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <cmath>

namespace rolvane {
namespace {

constexpr double kTellsEvery = 3600; // seconds
constexpr const char *kId = "id", *kSerial = "serial", *kDate = "date";

} // namespace

void CXDVaultraConduit::openAsOneOfSeveral() {
    _isOneOfSeveral = isOneOfSeveral(_with.preferences);
    _with.manager.mendOwnTreeOnly(_isOneOfSeveral);
    _takesIn = _isOneOfSeveral && isTakingIn(engine(), _with.preferences, _with.rolvane);
    _takenIn.reset();
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    _ownTreeIsHeld = _isOneOfSeveral && (_takesIn || !hasTold(users[kSelf.str()].dictionary()[kSerialNumber]));
    const auto own = baseLocationForUser(realUserFromUser(kSelf));
    if (!_isOneOfSeveral || !own || !_ACLManagerMap) return;
    // Another computer may have changed the list. Changes of this one that wait are kept with what it knew.
    const auto list = _ACLManagerMap->find(own->absoluteString());
    if (list != _ACLManagerMap->end() && list->second->unsaved().empty()) _ACLManagerMap->erase(list);
}

// A tree whose list of everybody is missing says of nobody whether they are still there.
bool CXDVaultraConduit::takesIn(Dictionary prior, const Dictionary& state) {
    const Dictionary list = state[std::string(layout::kAllGroup)].dictionary();
    if (!state[kSerialNumber].isString() || !list[kMemberUIDState].isArray()) {
        CXLog("The tree of this account has no list of its contacts, and is not taken in before it has one again.");
        return false;
    }
    prior.set(kTreeDates, state[kTreeDates].dictionary());
    _read.emplace(kSelf, state);
    return true;
}

bool CXDVaultraConduit::hasTold(const Value& serial) {
    const Dictionary told = _with.preferences.get(kDaemonDomain, kCXDToldOfItself).dictionary();
    return serial.isString() && told[kSerial] == serial && told[kId].string() == thisComputer(_with.preferences).id;
}

bool CXDVaultraConduit::isToTellAgain(const Value& serial) {
    if (!hasTold(serial)) return true;
    const auto last = _with.preferences.get(kDaemonDomain, kCXDToldOfItself).dictionary()[kDate].date();
    return !last || std::abs(_with.clock.now().secondsSince(*last)) >= kTellsEvery;
}

// The file costs requests only where it is another one than at the last look, or has to be told that this computer is
// there. While there is no second computer it is read and never written.
bool CXDVaultraConduit::keepsInStepWithOthers(Dictionary prior, const Dictionary& state) {
    const Value& version = state[ComputersOnStore::kFile];
    const Value& serial = state[kSerialNumber];
    const auto base = baseLocationForUser(realUserFromUser(kSelf));
    if (!base || (!version && !_isOneOfSeveral)) return true;
    Computer self = thisComputer(_with.preferences);
    // A copy of this memory on another machine has not looked yet.
    const Value look(self.id + " " + version.string());
    const bool tells = _isOneOfSeveral && isToTellAgain(serial);
    if (!tells && prior[ComputersOnStore::kFile] == look) return true;
    ComputersOnStore onStore(_with.manager, *base);
    auto computers = onStore.read();
    if (!computers) return true;
    const auto isSelf = [&](const Computer& each) { return each.id == self.id; };
    if (tells || (_isOneOfSeveral && std::none_of(computers->begin(), computers->end(), isSelf))) {
        self.seen = _with.clock.now();
        computers = onStore.put(self);
        if (!computers) return true; // what is held waits
        _with.preferences.set(kDaemonDomain, kCXDToldOfItself,
                              Dictionary{{kId, self.id}, {kSerial, serial}, {kDate, *self.seen}});
        _ownTreeIsHeld = false;
    } else {
        prior.set(ComputersOnStore::kFile, look);
    }
    _with.preferences.set(kDaemonDomain, kCXDComputers, valueOfComputers(*computers));
    if (_isOneOfSeveral || std::all_of(computers->begin(), computers->end(), isSelf)) return true;
    CXLog("Another computer keeps this publication in step, too.");
    becomeOneOfSeveral(_with.preferences);
    // This pass takes in nothing of the other one's, so it writes over nothing of it either.
    _isOneOfSeveral = _isWrittenByOthers = _ownTreeIsHeld = true;
    _with.manager.mendOwnTreeOnly(true);
    engine().bringSourcesUpToDate(); // after this pass
    return false;
}

// The clock file stays as it is: joining changes nothing on the store. Whoever wrote the tree touched it afterwards.
void CXDVaultraConduit::closeTakingIn() {
    if (!_takenIn || engine().hasPendingChanges(kSelf, CXDSyncSourceCX)) return;
    endTakingIn(engine());
    if (!_with.preferences.get(kDaemonDomain, kLastSyncDateKey)) {
        _lastSyncDate = _takenIn;
        _with.preferences.set(kDaemonDomain, kLastSyncDateKey, *_takenIn);
        _with.preferences.synchronize(kDaemonDomain);
    }
    CXLog("The tree of this account has been taken in.");
    engine().bringSourcesUpToDate(); // after this pass: now this computer's own contacts go
}

void CXDVaultraConduit::isOneOfSeveralNoMore() {
    if (!isOneOfSeveral(_with.preferences)) return;
    becomeTheOnlyOne(_with.preferences);
    forgetTakingIn(engine());
}

} // namespace rolvane
