#pragma once

#include "contacts/database/CXRolvane.h"

#include <set>
#include <string>
#include <vector>

namespace rolvane::cli {

// What every reader of the owner's tree gets of the contact database as it is, unsaved changes included.
struct Shown {
    std::set<UniqueId> people;
    std::vector<CXGroupRef> groups; // by name

    bool empty() const { return people.empty() && groups.empty(); }
    std::string amount() const; // "318 people and 6 groups", "1 person"
    bool isOne() const { return people.size() + groups.size() == 1; }
};
Shown shownToReaders(CXRolvane& database);
// What is in the one and not in the other.
Shown without(const Shown& all, const Shown& those);

} // namespace rolvane::cli
