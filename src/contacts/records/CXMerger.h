#pragma once

#include "contacts/records/CXPerson.h"
#include "foundation/Value.h"

namespace rolvane {

// Merges two cards of one person. Single values of the imported card win; multi-values are united by label and value,
// the card's own entries first and with their identifiers; lists of strings are united; dictionaries (and everything
// else) count as single values. A value that only one of the two has is always kept. Without state; any thread.
class CXMerger {
public:
    // Changes `card`. The imported card is left alone.
    void updateCard(CXPerson& card, const CXPerson& importedCard) const;
    // The same for bare properties: a new dictionary, its containers shared with neither.
    static Dictionary merged(const Dictionary& card, const Dictionary& importedCard);
};

} // namespace rolvane
