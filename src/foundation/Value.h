#pragma once

#include "foundation/CXException.h"
#include "foundation/Date.h"
#include "foundation/SharedObject.h"
#include "foundation/SharedText.h"

#include <cstdint>
#include <initializer_list>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <variant>
#include <vector>

namespace rolvane {

class Value;
struct DictionaryEntry;

using Bytes = std::vector<uint8_t>;

// An ordered list of values, shared by reference: a copy of the handle is the same array. Not locked; one thread at a
// time unless nobody writes. In a large array `contains` and `removeAll` of a string are O(1) expected: an index of the
// string elements is built on first need and kept up to date. What `removeAll` takes out leaves a gap that the next
// look at the order closes, for all removals since the last one.
class Array {
public:
    Array();
    Array(std::initializer_list<Value> values);
    explicit Array(std::vector<Value> values);

    size_t count() const;
    bool empty() const { return count() == 0; }
    const Value& operator[](size_t i) const; // CXException (kCXRangeException) beyond the end
    std::vector<Value>::const_iterator begin() const;
    std::vector<Value>::const_iterator end() const;

    void append(Value v);
    void appendAll(const Array& other);
    void insert(size_t index, Value v);
    void replace(size_t index, Value v);
    void removeAt(size_t index);
    void removeAll(const Value& v);        // every occurrence
    void removeAllOf(const Array& others); // every occurrence of every element, one walk
    void reserve(size_t n);

    bool contains(const Value& v) const;
    bool containsString(std::string_view s) const;
    std::optional<size_t> indexOf(const Value& v) const;

    Array mutableCopy() const; // a new array with the same elements (containers inside stay shared)
    bool isSame(const Array& other) const { return _p == other._p; } // identity
    friend bool operator==(const Array& a, const Array& b);          // by content

private:
    struct Storage;
    const std::vector<Value>& items() const; // without gaps
    SharedPointer<Storage> _p;
};

// String keys to values, shared by reference like Array. Enumerates in ascending byte order of the keys, always.
// Absent values cannot be stored: `set` with an absent value throws kCXInvalidArgumentException.
class Dictionary {
public:
    using Map = std::map<std::string, Value, std::less<>>;
    using const_iterator = Map::const_iterator;

    Dictionary();
    Dictionary(std::initializer_list<DictionaryEntry> entries); // {{"key", value}, ...}

    size_t count() const;
    bool empty() const { return count() == 0; }
    const_iterator begin() const;
    const_iterator end() const;

    const Value& operator[](std::string_view key) const; // the absent value when there is none
    bool contains(std::string_view key) const;
    void set(std::string_view key, Value v);
    bool setIfNew(std::string&& key, Value v); // false, and nothing changed, when the key is there already
    void remove(std::string_view key);
    void addEntriesFrom(const Dictionary& other); // other's entries win
    std::vector<std::string> allKeys() const;

    // The mutable container under the key, made empty when there is none or when it is of another kind.
    Dictionary dictionaryFor(std::string_view key);
    Array arrayFor(std::string_view key);

    Dictionary mutableCopy() const;                                   // shallow
    bool isSame(const Dictionary& other) const;                       // identity
    friend bool operator==(const Dictionary& a, const Dictionary& b); // by content

private:
    struct Storage;
    SharedPointer<Storage> _p;
};

enum class ValueType { absent, boolean, integer, real, string, date, data, array, dictionary };

// The one value type of the system: property lists, archives, preferences, payloads and states are all of these.
// Copying is cheap: strings and data are immutable and shared, containers are shared by reference.
// Equality is by content; an integer and a real are equal when their numbers are, a boolean equals only a boolean.
class Value {
public:
    Value() = default;
    Value(bool b) : _v(b) {}
    Value(int i) : _v(static_cast<int64_t>(i)) {}
    Value(unsigned i) : _v(static_cast<int64_t>(i)) {}
    Value(long i) : _v(static_cast<int64_t>(i)) {}
    Value(long long i) : _v(static_cast<int64_t>(i)) {}
    Value(unsigned long i) : _v(static_cast<int64_t>(i)) {}
    Value(double d) : _v(d) {}
    template <class T, class = std::enable_if_t<!std::is_same_v<std::remove_cv_t<T>, char>>>
    Value(T*) = delete; // or a pointer would become a boolean
    Value(const char* s) : _v(SharedText(s)) {}
    Value(std::string s) : _v(SharedText(std::move(s))) {}
    Value(std::string_view s) : _v(SharedText(std::string(s))) {}
    Value(SharedText s) : _v(std::move(s)) {}
    Value(Date d) : _v(d) {}
    Value(Bytes b) : _v(SharedPointer<SharedBytes>(new SharedBytes(std::move(b)))) {}
    Value(Array a) : _v(std::move(a)) {}
    Value(Dictionary d) : _v(std::move(d)) {}
    // A strong string is stored as its text, which the two share.
    template <class S, class = decltype(std::declval<const S&>().text()),
              class = std::enable_if_t<!std::is_convertible_v<S, std::string>>>
    Value(const S& s) : Value(s.text()) {}

    ValueType type() const { return static_cast<ValueType>(_v.index()); }
    bool isAbsent() const { return type() == ValueType::absent; }
    explicit operator bool() const { return !isAbsent(); } // present, whatever it is
    bool isString() const { return type() == ValueType::string; }
    bool isArray() const { return type() == ValueType::array; }
    bool isDictionary() const { return type() == ValueType::dictionary; }
    bool isDate() const { return type() == ValueType::date; }
    bool isData() const { return type() == ValueType::data; }
    bool isNumber() const { return type() == ValueType::integer || type() == ValueType::real; }

    // Tolerant readers: the given fallback when the value is of another kind. Nothing throws.
    bool boolean(bool otherwise = false) const;   // numbers: not zero
    int64_t integer(int64_t otherwise = 0) const; // reals are truncated, numeric strings are read
    double real(double otherwise = 0) const;
    const std::string& string() const; // "" when not a string
    std::optional<std::string> optionalString() const;
    std::optional<Date> date() const;
    const Bytes& data() const;     // empty when not data
    Array array() const;           // a new empty array when not an array
    Dictionary dictionary() const; // a new empty dictionary when not a dictionary
    const Array* arrayIf() const { return std::get_if<Array>(&_v); }
    const Dictionary* dictionaryIf() const { return std::get_if<Dictionary>(&_v); }
    const std::string* stringIf() const;
    const SharedText* textIf() const { return std::get_if<SharedText>(&_v); }

    Value deepMutableCopy() const; // every container inside is new; leaves are shared (they are immutable)

    // What "%@" shows: strings as they are at top level and quoted inside containers, containers over several lines,
    // data as its length, absent as "(null)"; what is nested deeper than 64 as "...".
    std::string description() const;

    friend bool operator==(const Value& a, const Value& b);

private:
    struct SharedBytes : SharedObject {
        explicit SharedBytes(Bytes b) : bytes(std::move(b)) {}
        const Bytes bytes;
    };
    std::variant<std::monostate, bool, int64_t, double, SharedText, Date, SharedPointer<SharedBytes>, Array, Dictionary>
        _v;
};

struct DictionaryEntry {
    std::string key;
    Value value;
};

inline std::string description(const Value& v) {
    return v.description();
}
inline std::string description(const Array& a) {
    return Value(a).description();
}
inline std::string description(const Dictionary& d) {
    return Value(d).description();
}

// Union of two string arrays: all of a in its order, then those of b that a lacks, in b's order.
Array cxArrayCombinedWithArray(const Array& a, const Array& b);
// {"additions": what current has and prior lacks, in current's order; "deletions": the other way, in prior's order}.
Dictionary cxDifferencesBetweenArray(const Array& prior, const Array& current);

} // namespace rolvane
