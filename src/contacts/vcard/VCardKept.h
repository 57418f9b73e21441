#pragma once

#include "contacts/vcard/VCardLine.h"

#include <optional>

namespace rolvane {

// Lines that are kept for their card because no property expresses them. They come from any version of vCard and are
// written in any; what the versions spell differently has one spelling in the database. Pure functions, any thread.

// The line as the database keeps it: binary values as data: URIs, references as VALUE=uri, a preference as PREF.
// Nothing when its binary value is damaged.
std::optional<VCardLine> vcardKeptForm(VCardLine line);

// The kept line as a card of version 4.0, or 3.0, has it. `vcardKeptForm` of that is the line again. Nothing when the
// version has no such line; then it can only stand inside an X-ROLVANE-KEPT.
std::optional<VCardLine> vcardKeptLineFor(const VCardLine& kept, bool version4);

} // namespace rolvane
