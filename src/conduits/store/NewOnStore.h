#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Mutex.h"

#include <unordered_set>
#include <vector>

namespace rolvane {

// Notes the new contacts and groups that other people may take in before the pass has come to its end: those with a
// file on the store and a name in the list of everybody. Somebody may delete such a record at once. A pass that was
// killed would otherwise be made again, and bring the record back.
//
// A contact's file comes before its name, and the note is durable before the name is written. A group's file follows
// its name; a process that is killed between that file and its note leaves none.
//
// A contact may be named though the store has refused its file. The note of that name is durable, too: it tells that
// the contact was never there, and nobody can have deleted it. Any thread.
class NewOnStore {
public:
    explicit NewOnStore(CXRolvane& rolvane) : _rolvane(rolvane) {} // borrowed

    // On the main thread. `newRecords`: those that this pass is to put there, as the database names them; borrowed.
    void beginPass(const std::unordered_set<UniqueId>& newRecords);
    // The store has the new record's file. `record`: as the database names it; `tree`: whose it is.
    void wasPut(const UserName& tree, const UniqueId& record, Date now);
    // The list of everybody is about to name them. Throws CXException where the note cannot be stored.
    void willName(const UserName& tree, const std::vector<UniqueId>& records, Date now);
    // The list could not be written that was to name them, or to name them no longer. New groups among them have to
    // wait, groups that name one of them, and deletions: whoever reads half a record would list it, or take it for
    // lost.
    void listWaits(const std::vector<UniqueId>& records);
    bool waitsForList(const UniqueId& record);  // in this pass
    bool isNamedAlone(const UniqueId& contact); // its file is not known to have come

private:
    void note(const std::vector<CXReached>& reached);

    CXRolvane& _rolvane;
    const std::unordered_set<UniqueId>* _newRecords = nullptr;
    Mutex _lock;
    std::unordered_set<UniqueId> _put GUARDED_BY(_lock);     // without a name, of all passes of this process
    std::unordered_set<UniqueId> _named GUARDED_BY(_lock);   // without a file, of this pass
    std::unordered_set<UniqueId> _alone GUARDED_BY(_lock);   // contacts without a file, of all passes
    std::unordered_set<UniqueId> _waiting GUARDED_BY(_lock); // for the list, in this pass
};

} // namespace rolvane
