#pragma once

#include "contacts/vcard/VCardReader.h"

#include <string>

namespace rolvane {

enum class VCardVersion { v3, v4 };

// The entity as the text of one card (RFC 2426 or RFC 6350), folded, with CRLF line ends. What the standard has no form
// for goes as X-ROLVANE-… properties, so that reading gives equal properties back (identifiers of multi-value entries
// aside), whatever the version. Who shares a record with whom is never written. Pure; any thread.
std::string vcardText(const VCardEntity& entity, VCardVersion version);

} // namespace rolvane
