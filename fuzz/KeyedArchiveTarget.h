#pragma once

#include "foundation/BinaryValue.h"
#include "foundation/KeyedArchive.h"

#include <stdexcept>

namespace rolvane::fuzz {

inline void checkBinaryValue(const Bytes& bytes) {
    Value value;
    try {
        value = BinaryValue::decode(bytes);
    } catch (const CXException& e) {
        if (e.name() != kCXArchiveException) throw std::logic_error("refused as " + e.name());
        return;
    }
    if (BinaryValue::encode(value) != bytes) throw std::logic_error("a value was decoded from a second form");
}

inline void checkArchive(const Bytes& bytes) {
    std::vector<KeyedArchive::Object> objects;
    try {
        objects = KeyedArchive::unarchive(bytes);
    } catch (const CXException& e) {
        if (e.name() != kCXArchiveException) throw std::logic_error("refused as " + e.name());
        return;
    }
    const Bytes again = KeyedArchive::archive(objects);
    if (KeyedArchive::archive(KeyedArchive::unarchive(again)) != again)
        throw std::logic_error("an archive that was written reads back as something else");
}

// Any bytes are decoded or refused with kCXArchiveException, as an archive and as a bare value (after a "RKA1" too, so
// that one corpus serves both). Throws std::logic_error when that does not hold.
inline void checkKeyedArchive(const uint8_t* data, size_t size) {
    const Bytes bytes(data, data + size);
    checkArchive(bytes);
    checkBinaryValue(bytes);
    if (size > 4) checkBinaryValue(Bytes(data + 4, data + size));
}

} // namespace rolvane::fuzz
