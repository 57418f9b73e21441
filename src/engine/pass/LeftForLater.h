#pragma once

#include "engine/EngineParts.h"
#include "engine/queue/TakenOut.h"
#include "model/CXDChangeRecord.h"

#include <optional>
#include <set>
#include <utility>

namespace rolvane {

// News from a store that a pass leaves as it is, since it contradicts changes of its own that are under way; the next
// comparison offers it again. For one pass, from the moment that its workers have ended; main thread.
class LeftForLater {
public:
    // `takenOut`: what one side of the pass takes out. `waiting`: what the workers could not write.
    LeftForLater(EngineParts& parts, const TakenOut& takenOut, const CXDChangeRecords& waiting)
        : _parts(parts), _takenOut(takenOut), _waiting(waiting) {}

    // A version of a contact that has come while our own one could not be written: taken in now, it would stand here
    // while ours, which is written with the next pass, stands on the store.
    bool meetsOwnWaitingWrite(const CXDChangeRecord& record);
    // A change of another user's publication that concerns what is deleted here. Where the deletion was refused, the
    // change is what brings it back.
    bool isOfWhatWasTakenOutHere(const CXDChangeRecord& record);

private:
    EngineParts& _parts;
    const TakenOut& _takenOut;
    const CXDChangeRecords& _waiting;
    std::optional<std::set<std::pair<UserName, UniqueId>>> _waitingWrites; // of contacts
    std::optional<std::set<UserName>> _refusedUsers;                       // whose store has refused something
};

} // namespace rolvane
