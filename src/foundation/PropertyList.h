#pragma once

#include "foundation/Value.h"

#include <string>
#include <string_view>

namespace rolvane {

struct PropertyListLimits {
    size_t maxBytes = 64u << 20;
    int maxDepth = 64;
};

// XML property lists. The writer is deterministic: equal values give equal bytes; UTF-8, tab indentation, keys in byte
// order. Characters that XML 1.0 cannot carry are refused with kCXPropertyListException naming the key.
// The reader refuses a DTD other than the standard external identifier without an internal subset, every entity but
// the five predefined ones, depth over the limit, and text over the size limit; it never opens a file or a connection.
class PropertyList {
public:
    static std::string toXML(const Value& value);
    // Throws kCXPropertyListException with line and reason.
    static Value fromXML(std::string_view text, const PropertyListLimits& limits = {});
    static Value fromFile(const std::string& path, const PropertyListLimits& limits = {});
};

// A compact binary form of a Value for rows and archives:
//   value  = tag payload      tag: one byte, the ValueType (booleans 0x10 false, 0x11 true)
//   integer = zigzag varint, real/date = 8 bytes little endian IEEE 754, string/data = varint length + bytes,
//   array = varint count + values, dictionary = varint count + (string value)* in ascending key order
// Equal values give equal bytes. Decoding checks every length and depth (64) and throws kCXArchiveException.
class BinaryValue {
public:
    static Bytes encode(const Value& value);
    static void encodeTo(const Value& value, Bytes& out);
    static Value decode(const uint8_t* data, size_t size);
    static Value decode(const Bytes& bytes) { return decode(bytes.data(), bytes.size()); }
};

} // namespace rolvane
