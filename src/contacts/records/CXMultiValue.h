#pragma once

#include "foundation/Value.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// An ordered list of labelled values, each with an identifier that stays with it through edits (distribution choices
// name it). A value type: copies are independent. An empty multi-value is a value; absence of one is an absent Value.
// As a Value: {"identifiers": [strings], "labels": [strings], "values": [values]}, three arrays of one length.
class CXMultiValue {
public:
    struct Entry {
        std::string identifier;
        std::string label; // "" when it has none
        Value value;
        friend bool operator==(const Entry&, const Entry&) = default;
    };

    CXMultiValue() = default;
    // From the Value form. Nothing when it is not such a dictionary ("values" missing or not an array). Missing
    // labels become "", missing, empty or doubled identifiers are made fresh; extra ones are ignored.
    static std::optional<CXMultiValue> fromValue(const Value& value);
    // True for a dictionary with an array under "values".
    static bool isMultiValue(const Value& value);

    size_t count() const { return _entries.size(); }
    bool empty() const { return _entries.empty(); }
    const Value& valueAtIndex(size_t i) const; // these three: kCXRangeException beyond the end
    const std::string& labelAtIndex(size_t i) const;
    const std::string& identifierAtIndex(size_t i) const;
    std::optional<size_t> indexForIdentifier(std::string_view identifier) const;
    std::optional<std::string> labelForIdentifier(std::string_view identifier) const;
    Value valueForIdentifier(std::string_view identifier) const; // absent when there is none
    Array _allValues() const;                                    // a new array, in order

    // Enumeration yields the identifiers, in order.
    std::vector<std::string> identifiers() const;
    const std::vector<Entry>& entries() const { return _entries; }

    Value toValue() const; // new containers at every call
    static std::string _generateIdentifier();

    friend bool operator==(const CXMultiValue&, const CXMultiValue&) = default; // identifiers count
    // Equal labels and values in order, whatever the identifiers.
    bool sameContents(const CXMultiValue& other) const;
    friend std::string description(const CXMultiValue& m) { return m.toValue().description(); }

protected:
    std::vector<Entry> _entries;
};

// The same with operations that change it.
class CXMutableMultiValue : public CXMultiValue {
public:
    CXMutableMultiValue() = default;
    explicit CXMutableMultiValue(CXMultiValue from) : CXMultiValue(std::move(from)) {}

    // Appends and gives the new identifier. An absent value throws kCXInvalidArgumentException.
    std::string addValue(Value value, std::string_view label);
    std::string addValue(Value value, std::string_view label, std::string_view identifier); // "" or taken: a fresh one
    std::string insertValue(Value value, std::string_view label, size_t index);             // at most count()
    void removeAtIndex(size_t i);                                                           // kCXRangeException
    bool removeIdentifier(std::string_view identifier);                                     // false when not there
    void removeAll() { _entries.clear(); }
    void replaceValueAtIndex(size_t i, Value value);
    void replaceLabelAtIndex(size_t i, std::string_view label);
    bool replaceValueForIdentifier(std::string_view identifier, Value value);
    void generateIdentifiers(); // a fresh identifier for every entry
};

} // namespace rolvane
