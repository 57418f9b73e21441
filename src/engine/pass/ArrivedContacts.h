#pragma once

#include "engine/EngineParts.h"
#include "model/CXDChangeRecord.h"

#include <map>
#include <optional>
#include <utility>

namespace rolvane {

// A commit in the middle of a pass, and the people and groups that the database has taken since the last one. The
// database has everybody in its list of all as soon as they are there; the change that says so comes later in the pass.
// Were the pass killed in between, the next one would take them for the user's own. For one pass; main thread.
class ArrivedContacts {
public:
    explicit ArrivedContacts(EngineParts& parts) : _parts(parts) {}

    void note(const CXDChangeRecordPtr& applied); // to the database; what brings nobody is left out
    // Commits the contacts so far, and what is known of them. `toCome`: what the pass applies in order, and the place
    // of the first that it has not applied; each call is given the same list.
    void save(const CXDChangeRecords& toCome, size_t next);

private:
    void list(const CXDChangeRecords& toCome, size_t next);

    EngineParts& _parts;
    CXDChangeRecords _arrived; // since the last commit
    using Listings = std::map<std::pair<UserName, UniqueId>, CXDChangeRecordPtr>;
    std::optional<Listings> _listings; // by whose and who, the changes that put them into the list of all
};

} // namespace rolvane
