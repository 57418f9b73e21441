#include "contacts/records/CXMerger.h"

#include <algorithm>

namespace rolvane {

namespace {

CXMultiValue united(const CXMultiValue& own, const CXMultiValue& imported) {
    CXMutableMultiValue all(own);
    // An entry may stand in a card twice; each of the imported ones answers for one of the card's own.
    std::vector<bool> answered(own.count(), false);
    for (const auto& entry : imported.entries()) {
        size_t i = 0;
        while (i < own.count() &&
               (answered[i] || own.labelAtIndex(i) != entry.label || own.valueAtIndex(i) != entry.value))
            i++;
        if (i < own.count())
            answered[i] = true;
        else
            all.addValue(entry.value.deepMutableCopy(), entry.label, entry.identifier);
    }
    return all;
}

bool isListOfStrings(const Value& value) {
    const Array* array = value.arrayIf();
    return array && std::all_of(array->begin(), array->end(), [](const Value& v) { return v.isString(); });
}

Value mergedValue(const Value& own, const Value& imported) {
    if (!own) return imported.deepMutableCopy();
    auto ownMulti = CXMultiValue::fromValue(own), importedMulti = CXMultiValue::fromValue(imported);
    if (ownMulti && importedMulti) return united(*ownMulti, *importedMulti).toValue();
    if (ownMulti) return own; // a multi-value is not lost to something of another kind
    if (isListOfStrings(own) && isListOfStrings(imported))
        return cxArrayCombinedWithArray(own.array(), imported.array());
    return imported.deepMutableCopy();
}

} // namespace

Dictionary CXMerger::merged(const Dictionary& card, const Dictionary& importedCard) {
    Dictionary result = Value(card).deepMutableCopy().dictionary();
    for (const auto& [key, value] : importedCard) result.set(key, mergedValue(result[key], value));
    return result;
}

void CXMerger::updateCard(CXPerson& card, const CXPerson& importedCard) const {
    Dictionary own = card.dictionaryRepresentation();
    Dictionary result = merged(own, importedCard.dictionaryRepresentation());
    for (const auto& [key, value] : result)
        if (own[key] != value) card.setValue(value, key);
}

} // namespace rolvane
