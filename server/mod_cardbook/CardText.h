#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/vcard/VCardWriter.h"

#include <string>

namespace rolvane::cardbook {

// Counted up when the same record would be written in another way; it is part of every entity tag.
inline constexpr int kCardTextEdition = 1;

// The card of a person. Categories are the person's own; groups have cards and books of their own. What the database
// keeps for itself is left out.
VCardEntity personEntity(const UniqueId& uid, const Dictionary& properties);
std::string personText(const UniqueId& uid, const Dictionary& properties, VCardVersion version);

// The card of a group, with its members and subgroups. Chosen values of members are not in it.
VCardEntity groupEntity(CXRolvane& rolvane, const CXGroup& group);
// The part of a group's card that differs from one state to the next.
Bytes groupDigestText(const VCardEntity& entity);

// The UID that the record's card shows.
std::string uidTextOf(const UniqueId& uid, const Dictionary& properties);

} // namespace rolvane::cardbook
