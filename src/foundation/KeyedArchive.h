#pragma once

#include "foundation/Value.h"

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// What an object writes itself with. A coder that is not keyed is offered so that objects can refuse it.
class Coder {
public:
    virtual ~Coder() = default;
    virtual bool allowsKeyedCoding() const = 0;
    virtual void encodeInteger(int64_t value, std::string_view key) = 0;
    virtual void encodeObject(const Value& value, std::string_view key) = 0; // an absent value writes nothing
    virtual int64_t decodeInteger(std::string_view key) const = 0;           // 0 when missing
    virtual Value decodeObject(std::string_view key) const = 0;              // absent when missing
};

// A keyed coder over one dictionary.
class DictionaryCoder : public Coder {
public:
    DictionaryCoder() = default;
    explicit DictionaryCoder(Dictionary from) : _entries(std::move(from)) {}
    bool allowsKeyedCoding() const override { return true; }
    void encodeInteger(int64_t value, std::string_view key) override;
    void encodeObject(const Value& value, std::string_view key) override;
    int64_t decodeInteger(std::string_view key) const override;
    Value decodeObject(std::string_view key) const override;
    const Dictionary& entries() const { return _entries; }

private:
    Dictionary _entries;
};

// A keyed archive: an array of objects of named classes, as bytes.
//   archive = "RKA1" BinaryValue{ "objects": [ { "class": name, "keys": {...} }, ... ] }
class KeyedArchive {
public:
    struct Object {
        std::string className;
        Dictionary keys;
    };
    static Bytes archive(const std::vector<Object>& objects);
    // The same bytes from objects that are made one after the other, so that they never stand in memory together.
    static Bytes archive(size_t count, const std::function<Object(size_t)>& objectAt);
    static std::vector<Object> unarchive(const Bytes& bytes); // throws kCXArchiveException
    // Hands over one object after the other, so that they need not stand in memory together. Throws the same, and then
    // some objects may have been handed over.
    static void unarchive(const Bytes& bytes, const std::function<void(Object)>& take);
};

} // namespace rolvane
