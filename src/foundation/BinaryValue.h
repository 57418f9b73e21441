#pragma once

#include "foundation/Value.h"

namespace rolvane {

// A compact binary form of a Value for rows and archives:
//   value  = tag payload      tag: one byte, the ValueType (booleans 0x10 false, 0x11 true)
//   integer = zigzag varint, real/date = 8 bytes little endian IEEE 754, string/data = varint length + bytes,
//   array = varint count + values, dictionary = varint count + (string value)* in ascending key order
//   varint = base 128, least significant group first, high bit set on all but the last byte, shortest form only
// Equal values of equal types give equal bytes, and one value has one form only: decoding refuses every other. It
// checks every length, nesting (64 containers) and that nothing follows, and throws kCXArchiveException. Encoding
// throws the same for deeper nesting, a container that holds itself among them. Strings may hold any bytes.
class BinaryValue {
public:
    static constexpr int kMaxDepth = 64;

    static Bytes encode(const Value& value);
    static void encodeTo(const Value& value, Bytes& out); // appends; what was appended is undefined after a throw
    static Value decode(const uint8_t* data, size_t size);
    static Value decode(const Bytes& bytes) { return decode(bytes.data(), bytes.size()); }
    // The form of a data value, and its value, in the memory that the bytes have: for data that is large.
    static Bytes encodeData(Bytes data);
    static Value decode(Bytes&& bytes);
    // One value at the front of the bytes, which then begin behind it.
    static Value decodeFront(const uint8_t*& data, size_t& size);
    static uint64_t decodeCount(const uint8_t*& data, size_t& size); // a varint, likewise
};

} // namespace rolvane
