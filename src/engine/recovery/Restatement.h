#pragma once

#include "foundation/StrongString.h"
#include "model/CXDChangeRecord.h"

#include <cstddef>
#include <functional>

namespace rolvane {

class CXDConduit;
class CXRolvane;

// A change that waited for a store says what was true when it was made. Before a pass applies it, it is restated as
// what the database says of its subject now, so the order in which changes waited does not matter.
//
// Content of a contact that has left the database becomes the contact's removal, and any change of such a group the
// group's: nothing that is known of the store would ever take away what such a change puts there, or has put there
// before its answer was lost. Whoever was to be put into a group is taken out of it and removed. The removal of a
// contact or group that is in the database again (an undone deletion, an imported card) is dropped; of a copy, where a
// person has made it again. All other changes of an own group give way to one comparison of the group with what is
// known of its store. Of a group in a writer's copies, which may be older than that store, only those parts are dropped
// that the person has taken back.
struct Restatement {
    CXRolvane& rolvane;
    CXDConduit& database;                                // the contact database's
    std::function<bool(const UserName& user)> hasCopies; // is the user's tree the one that the copies here came from?

    // `records`: the pass's input, `fresh` new ones and then the queue, which alone is looked at, and of it the changes
    // in trees whose copies are here. Changes of groups that give way may be on the store, their answers lost: the note
    // of writes under way still has them. Main thread. Throws CXDamagedDatabase; some of `records` may then be restated
    // already.
    void restate(CXDChangeRecords& records, size_t fresh) const;
    // The same but for the comparison of groups.
    void withdrawWhatIsGone(CXDChangeRecords& records, size_t fresh) const;
    void dropRemovalsOfWhatIsBack(CXDChangeRecords& records, size_t fresh) const;
    // Of groups in a writer's copies, whose other changes are sent as they are.
    void dropWhatAWriterUndid(CXDChangeRecords& records, size_t fresh) const;

private:
    bool isCopyMadeAgain(const UniqueId& person) const; // by somebody at this computer
    void compareGroups(CXDChangeRecords& records, size_t fresh) const;
};

} // namespace rolvane
