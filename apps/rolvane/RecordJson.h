#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Value.h"

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

namespace rolvane::cli {

// A value as JSON: data in base64, dates as RFC 3339 text, an absent value as null. Text that is not UTF-8 is mended.
nlohmann::ordered_json toJson(const Value& value);

// A person whole: identifier, name, location (subscribed ones), dates, groups, all properties.
nlohmann::ordered_json toJson(CXPerson& person);
// The same document of a row, with its decoded properties and the names of the groups, as text in one line. It is
// written straight, for lists of very many.
std::string jsonText(const CXRow& row, const Dictionary& properties, const std::vector<std::string>& groups);
// A group whole: identifier, name, location, members, subgroups, distribution choices, what it is published at.
nlohmann::ordered_json toJson(CXGroup& group);

// The publisher's name, null for the owner's own.
nlohmann::ordered_json ownerJson(const RemoteLocation& location);
// Whose a subscribed record is, where it came from, and whether it may be changed, as text for people.
std::string fromText(const CXRecord& record);

// A value for people, in one line.
std::string oneLine(const Value& value);

// A person as lines for people.
std::string personText(CXPerson& person);

} // namespace rolvane::cli
