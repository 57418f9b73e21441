#pragma once

#include "contacts/vcard/VCardReader.h"

#include <set>
#include <string>

namespace rolvane::cardbook {

// A card as a client sent it.
struct ClientCard {
    VCardEntity entity; // a person's categories stand among the properties
    bool isVersion4 = false;
    bool isWhole = true;             // no line was left out or kept unread
    std::set<std::string> lineNames; // in capitals
    std::string text;
};

// Throws Refused: valid-address-data for a text that is no vCard, holds several, or has no name;
// supported-address-data for another version than 3.0 and 4.0. Pure.
ClientCard readClientCard(const std::string& text);

} // namespace rolvane::cardbook
