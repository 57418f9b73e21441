#pragma once

#include "contacts/records/ContactMerge.h"
#include "foundation/StrongString.h"
#include "server/mod_cardbook/ClientCard.h"

#include <functional>
#include <optional>

namespace rolvane::cardbook {

// Whether a device is known to understand a property of the dictionary, or a kept line ("line:X-COLOUR"). What it does
// not understand it has not taken away when it leaves it out.
using Knows = std::function<bool(const std::string&)>;

// The properties of a client's card that only some clients can say, in the names that Knows is asked with.
std::set<std::string> knowledgeOf(const ClientCard& card);

// The person's properties when a client has written its card over them.
// - `had`: the properties of the version that the client had; nothing where it is not known.
// - `now`: the present ones.
// A property that the client changed against what it had is changed, the rest stays; both sides' edits are merged as
// two people's are. Entries keep their identifiers, and thereby the choices of groups. Pure.
CXMergeResult mergedCard(const UniqueId& uid, const std::optional<Dictionary>& had, const Dictionary& now,
                         const ClientCard& card, const Knows& knows);

// Does the text of the card say the same as the properties do, so that it may stand for them?
bool saysTheSame(const UniqueId& uid, const Dictionary& properties, const ClientCard& card);

} // namespace rolvane::cardbook
