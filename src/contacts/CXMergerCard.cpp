#include "contacts/CXMerger.h"

namespace rolvane {

void CXMerger::updateCard(CXPerson& card, const CXPerson& importedCard) const {
    Dictionary own = card.dictionaryRepresentation();
    Dictionary result = merged(own, importedCard.dictionaryRepresentation());
    for (const auto& [key, value] : result)
        if (own[key] != value) card.setValue(value, key);
}

} // namespace rolvane
