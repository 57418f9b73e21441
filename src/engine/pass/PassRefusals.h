#pragma once

#include "engine/EngineParts.h"
#include "model/CXDChangeRecord.h"

#include <unordered_set>
#include <vector>

namespace rolvane {

// Stores' refusals in one pass: the changes that are given up with a refused one, and the notes of them for people and
// for the next scan. Main thread.
class PassRefusals {
public:
    explicit PassRefusals(EngineParts& parts) : _parts(parts) {}

    // A refused change, which the workers were not given: the same user's changes among `others` are skipped. The list
    // stays the same for the whole pass, so one walk a user is enough.
    void cancelLike(const CXDChangeRecordPtr& refused, const CXDChangeRecords& others);
    // The owner's are left to the next scan. To be called before anything of the pass is saved, and at its end.
    void note();
    // The end: what was refused is told. A refused change in a copy is undone there: contacts are read again, and a
    // group counts as changed on the store, so that the next comparison finds the store without the change.
    void takeBack();
    void tell();
    // The refused changes of copies that a person has made, of whose publishers: a record's user for each.
    std::vector<UserName> ofCopies() const;

private:
    void takeBack(const CXDChangeRecord& record);

    EngineParts& _parts;
    std::unordered_set<UserName> _cancelledUsers;
};

// Is the record cancelled with a refused one, so that no source holds what it says? Not of changes in copies of
// somebody else's contacts: those count as made there, and the next comparison undoes them in the copy.
bool isGivenUp(EngineParts& parts, const CXDChangeRecord& record);

} // namespace rolvane
