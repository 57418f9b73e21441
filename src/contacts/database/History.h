#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/database/ChangeLog.h"

#include <string>
#include <vector>

namespace rolvane {

// The result of taking a change back.
struct CXUndone {
    size_t broughtBack = 0, removed = 0, changed = 0, memberships = 0;
    size_t asOwn = 0;              // of those brought back: copies of somebody who shares no more, or allows no writing
    std::vector<std::string> left; // each a sentence: what stays as it is, and why
    bool anything() const { return broughtBack + removed + changed + memberships > 0; }
};

// The changes of a contact database: told, and taken back (ChangeLog.h says how long). Any thread.
class CXHistory {
public:
    explicit CXHistory(CXRolvane& rolvane) : _rolvane(rolvane) {}

    // From now on all saves of this process are one change, by this command.
    void savesAreOne(const std::string& command);

    std::vector<CXLoggedChange> latest(size_t limit, const std::optional<UniqueId>& of = {}); // newest first
    std::optional<CXLoggedChange> change(int64_t number);
    std::vector<CXChangeDetail> details(int64_t change, const std::optional<UniqueId>& of = {});
    // Of what was changed: the properties afterwards. Empty for what was deleted, and where they are not known.
    Dictionary after(const CXChangeDetail& detail);
    // Deleted records whose name or identifier this is, the latest deletion first, each once.
    std::vector<UniqueId> deletedNamed(const std::string& name);
    // The number of the last change until that moment. Nothing where the log does not reach back so far, or the clock
    // was set back from there.
    std::optional<int64_t> lastUntil(Date moment);
    // Was a person or a subgroup in the group behind that change? `isNow`: in the present.
    bool wasListed(int64_t change, const UniqueId& group, const UniqueId& member, bool isNow);
    std::string nameOf(const CXChangeDetail& detail); // as it was before, or is now; else the identifier

    // Takes the change back, unsaved. Property by property: what was changed again since stays.
    CXUndone undo(int64_t change);
    void noteUndone(int64_t change); // durable on return
    // Nothing of the record is left in the log, nor in the other things that are kept of edits. Durable on return, and
    // overwritten in the file.
    void forget(const UniqueId& uid);

private:
    class Undoing;
    CXRolvane& _rolvane;
};

} // namespace rolvane
