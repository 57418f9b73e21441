#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/records/ContactMerge.h"
#include "foundation/Mutex.h"
#include "foundation/Url.h"
#include "foundation/Value.h"
#include "model/CXDChangeRecord.h"

#include <functional>
#include <optional>
#include <unordered_set>
#include <vector>

namespace rolvane {

class CXDAVManager;

// The contact as it comes back from a store: dates to the second, for instance.
Dictionary cxAsSent(const Dictionary& contact);
// The status of a question, as it counts for the change that it was asked for. 403 refuses the change where the tree is
// closed altogether, which its information tells; else it is one of the question alone, and the change waits: 0.
int cxAfterQuestion(CXDAVManager& manager, const Url& base, int code);

// Merges `here`, as it is sent, with `there` against the last version that the database and the store have had in
// common, and against what has been on its way since. `common`: none where nothing is known of it. `written`: when
// `there` was put there, to the second, as the store has it.
CXMergeResult cxMergedWithStore(const std::optional<CXCommonVersion>& common, const Dictionary& here,
                                const Dictionary& there, CXSide later, const std::optional<Date>& written);

// Writes edited contacts into trees that others write to, too. A version that the client does not know is merged with
// the own one (contacts/records/ContactMerge.h) before it is written over, and only the version that was read is
// written over.
//
// Steps of one write, and what a process that is killed behind each of them leaves:
//   read the store's version    nothing
//   note the conflicts          the note, which is not made twice
//   write the merged contact    the edit still waits; merged again with its own result it gives that result
//   tell the database           the common version is as old as before: the same
// Any thread.
class ContactWrites {
public:
    // Both borrowed.
    ContactWrites(CXDAVManager& manager, CXRolvane& rolvane) : _manager(manager), _rolvane(rolvane) {}

    // Before the writes of a pass, on its main thread. A contact that no store is known to have had gets this content
    // as the common version, in the unit of work: should the pass come to no end, the store has it, or has nothing. Of
    // an edited one the content is kept beside the common version: the store may have either.
    void beginPass() { _new.clear(); }
    void willWrite(const Url& location, const UniqueId& uniqueId, const std::function<Dictionary()>& content);

    struct Place {
        UserName user;     // of the tree
        Url location;      // of the contact's file
        UniqueId uniqueId; // of the contact in the database
        bool merges;       // others may have written there, and what they wrote may be taken in here
        Url base;          // of the tree
        std::function<bool()>
            wasListed; // whether the list of everybody is known to have named the contact; asked at most once
        bool wasNeverThere = false; // no store has had its file, so nobody can have deleted it: its change waits
    };
    // True when the store has the content afterwards, alone or merged, and when somebody else has deleted the contact:
    // its file is gone and the list that named it does not any more. `code`: the last answer's status; 412 when
    // somebody else was faster several times.
    bool write(const Place& place, const Dictionary& ours, int& code);

    // Contacts that were merged since the last call; the database has to take them in.
    struct Merged {
        Place place;
        Dictionary contact;
    };
    std::vector<Merged> takeMerged();
    // Merged contacts that nobody has taken count as not seen yet.
    void giveUpMerged();

private:
    bool put(const Place& place, const Dictionary& content, int& code);
    bool writeOver(const Place& place, const Dictionary& ours, int& code);
    bool writeWhereNoneIs(const Place& place, const Dictionary& ours, int& code);
    bool writeMerged(const Place& place, const Dictionary& ours, const Dictionary& theirs,
                     const std::optional<Date>& theirDate, int& code);

    CXDAVManager& _manager;
    CXRolvane& _rolvane;
    std::unordered_set<UniqueId> _new; // of this pass; constant while it writes
    Mutex _lock;
    std::vector<Merged> _merged GUARDED_BY(_lock);
};

} // namespace rolvane
