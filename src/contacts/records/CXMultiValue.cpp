#include "contacts/records/CXMultiValue.h"

#include "foundation/Paths.h"

#include <algorithm>
#include <set>

namespace rolvane {

namespace {

constexpr std::string_view kLabels = "labels";
constexpr std::string_view kValues = "values";
constexpr std::string_view kIdentifiers = "identifiers";

[[noreturn]] void throwRange(size_t i, size_t count) {
    throw CXException(kCXRangeException, "There is no entry " + std::to_string(i) + " in a multi-value of " +
                                             std::to_string(count) + " entries.");
}

} // namespace

bool CXMultiValue::isMultiValue(const Value& value) {
    const Dictionary* dictionary = value.dictionaryIf();
    return dictionary && (*dictionary)[kValues].isArray();
}

std::optional<CXMultiValue> CXMultiValue::fromValue(const Value& value) {
    if (!isMultiValue(value)) return std::nullopt;
    const Dictionary& dictionary = *value.dictionaryIf();
    Array values = dictionary[kValues].array();
    Array labels = dictionary[kLabels].array();
    Array identifiers = dictionary[kIdentifiers].array();
    CXMultiValue result;
    std::set<std::string, std::less<>> taken;
    for (size_t i = 0; i < values.count(); i++) {
        std::string identifier = i < identifiers.count() ? identifiers[i].string() : "";
        if (identifier.empty() || taken.contains(identifier)) identifier = _generateIdentifier();
        taken.insert(identifier);
        result._entries.push_back({identifier, i < labels.count() ? labels[i].string() : "", values[i]});
    }
    return result;
}

Value CXMultiValue::toValue() const {
    std::vector<Value> identifiers, labels, values;
    for (const Entry& e : _entries) {
        identifiers.emplace_back(e.identifier);
        labels.emplace_back(e.label);
        values.push_back(e.value.deepMutableCopy());
    }
    return Dictionary{{std::string(kIdentifiers), Array(std::move(identifiers))},
                      {std::string(kLabels), Array(std::move(labels))},
                      {std::string(kValues), Array(std::move(values))}};
}

const Value& CXMultiValue::valueAtIndex(size_t i) const {
    if (i >= _entries.size()) throwRange(i, _entries.size());
    return _entries[i].value;
}

const std::string& CXMultiValue::labelAtIndex(size_t i) const {
    if (i >= _entries.size()) throwRange(i, _entries.size());
    return _entries[i].label;
}

const std::string& CXMultiValue::identifierAtIndex(size_t i) const {
    if (i >= _entries.size()) throwRange(i, _entries.size());
    return _entries[i].identifier;
}

std::optional<size_t> CXMultiValue::indexForIdentifier(std::string_view identifier) const {
    for (size_t i = 0; i < _entries.size(); i++)
        if (_entries[i].identifier == identifier) return i;
    return std::nullopt;
}

std::optional<std::string> CXMultiValue::labelForIdentifier(std::string_view identifier) const {
    std::optional<size_t> i = indexForIdentifier(identifier);
    return i ? std::optional(_entries[*i].label) : std::nullopt;
}

Value CXMultiValue::valueForIdentifier(std::string_view identifier) const {
    std::optional<size_t> i = indexForIdentifier(identifier);
    return i ? _entries[*i].value : Value();
}

Array CXMultiValue::_allValues() const {
    Array all;
    for (const Entry& e : _entries) all.append(e.value);
    return all;
}

std::vector<std::string> CXMultiValue::identifiers() const {
    std::vector<std::string> all;
    for (const Entry& e : _entries) all.push_back(e.identifier);
    return all;
}

std::string CXMultiValue::_generateIdentifier() {
    return makeUUID();
}

bool CXMultiValue::sameContents(const CXMultiValue& other) const {
    return std::equal(_entries.begin(), _entries.end(), other._entries.begin(), other._entries.end(),
                      [](const Entry& a, const Entry& b) { return a.label == b.label && a.value == b.value; });
}

std::string CXMutableMultiValue::addValue(Value value, std::string_view label) {
    return insertValue(std::move(value), label, _entries.size());
}

std::string CXMutableMultiValue::addValue(Value value, std::string_view label, std::string_view identifier) {
    std::string made = addValue(std::move(value), label);
    if (identifier.empty() || indexForIdentifier(identifier)) return made;
    return _entries.back().identifier = identifier;
}

std::string CXMutableMultiValue::insertValue(Value value, std::string_view label, size_t index) {
    if (value.isAbsent())
        throw CXException(kCXInvalidArgumentException, "An absent value cannot be an entry of a multi-value.");
    if (index > _entries.size()) throwRange(index, _entries.size());
    auto at = _entries.insert(_entries.begin() + static_cast<std::ptrdiff_t>(index),
                              {_generateIdentifier(), std::string(label), std::move(value)});
    return at->identifier;
}

void CXMutableMultiValue::removeAtIndex(size_t i) {
    if (i >= _entries.size()) throwRange(i, _entries.size());
    _entries.erase(_entries.begin() + static_cast<std::ptrdiff_t>(i));
}

bool CXMutableMultiValue::removeIdentifier(std::string_view identifier) {
    std::optional<size_t> i = indexForIdentifier(identifier);
    if (i) removeAtIndex(*i);
    return i.has_value();
}

void CXMutableMultiValue::replaceValueAtIndex(size_t i, Value value) {
    if (i >= _entries.size()) throwRange(i, _entries.size());
    if (value.isAbsent())
        throw CXException(kCXInvalidArgumentException, "An absent value cannot be an entry of a multi-value.");
    _entries[i].value = std::move(value);
}

void CXMutableMultiValue::replaceLabelAtIndex(size_t i, std::string_view label) {
    if (i >= _entries.size()) throwRange(i, _entries.size());
    _entries[i].label = label;
}

bool CXMutableMultiValue::replaceValueForIdentifier(std::string_view identifier, Value value) {
    std::optional<size_t> i = indexForIdentifier(identifier);
    if (i) replaceValueAtIndex(*i, std::move(value));
    return i.has_value();
}

void CXMutableMultiValue::generateIdentifiers() {
    for (Entry& e : _entries) e.identifier = _generateIdentifier();
}

} // namespace rolvane
