#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/records/AlikePeople.h"

#include <string>
#include <vector>

namespace rolvane {

// People who look alike, and making one of several. Borrows the database; one thread.

struct AlikePeople {
    CXAlikeness alikeness = CXAlikeness::none; // of the two who are least alike
    std::vector<UniqueId> people;              // two at least, in display order
};

// The owner's own people in groups of those who look alike: of the same name, or reached by the same address or number.
// Nobody stands in two groups of the same name; surest groups first.
std::vector<AlikePeople> findAlikePeople(CXRolvane& rolvane);

// Properties of one person made of two, by CXMerger: lists are united, and of single values the first's stay. What of
// the second's gives way goes into the note, and a second photo is kept as a line of the card.
struct JoinedProperties {
    Dictionary properties;
    std::vector<std::string> gaveWay; // "JobTitle: Cook"
};
JoinedProperties joinedProperties(const Dictionary& first, const Dictionary& second, const UniqueId& secondUid);

// Makes one of two people: the first gets what the second has, also its groups and what they have chosen, and the
// second is removed. Cards with the second's UID mean the first from then on. Unsaved. Gives what gave way.
std::vector<std::string> joinPeople(CXRolvane& rolvane, const CXPersonRef& first, const CXPersonRef& second);

} // namespace rolvane
