#pragma once

#include "contacts/database/CXRolvane.h"

#include <string>
#include <vector>

namespace rolvane::cli {

// What a person names on the command line: an identifier, the start of one (at least 4 characters), or a name (letter
// case does not matter; an exact match wins over a part). Throws CommandError kNotFound when nothing or several match;
// the message lists the candidates.
// With `whole` a part of a name is not enough: for what cannot be taken back.
std::vector<CXListing> peopleMatching(CXRolvane& database, const std::string& named, bool whole);
CXPersonRef findPerson(CXRolvane& database, const std::string& named, bool whole = false);
CXGroupRef findGroup(CXRolvane& database, const std::string& named, bool whole = false);

// Throws CommandError kRefused with the reason when the record is a copy that may be read but not changed.
void requireWritable(const CXRecord& record);
// A group whose members and name a person may change: not an all-contacts group, and as requireWritable.
CXGroupRef findChangeableGroup(CXRolvane& database, const std::string& named, bool whole = false);

} // namespace rolvane::cli
