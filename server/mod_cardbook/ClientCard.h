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

// Of the lines and values of a card. Those of a client have bounds that no program comes near. A card that is made here
// from the database has none.
enum class Bounds { none, ofClients };

// Throws Refused: valid-address-data for a text that is no vCard, holds several, has no name, or more than the bounds
// allow; supported-address-data for another version than 3.0 and 4.0. Pure.
ClientCard readClientCard(const std::string& text, Bounds bounds = Bounds::none);

} // namespace rolvane::cardbook
